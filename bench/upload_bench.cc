// Uploads a package of generated files (default 1 GiB) through lighttpd and
// installs it through the web API, printing: upload throughput next to `cp`
// of the same file on the same volume, the API install next to the package
// tool alone, and the peak memory of entry.cgi during the upload.
//
//   upload_bench [payload MiB]

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <json/reader.h>

#include "bench_setup.h"
#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/payload_generator.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point since) {
  return std::chrono::duration<double>(Clock::now() - since).count();
}

// The largest VmHWM (peak resident set, KiB) of any running entry.cgi.
long EntryCgiPeakKib() {
  long peak = 0;
  DIR* proc = opendir("/proc");
  while (struct dirent* e = proc ? readdir(proc) : nullptr) {
    if (e->d_name[0] < '0' || e->d_name[0] > '9') continue;
    std::string base = std::string("/proc/") + e->d_name;
    std::string comm;
    if (!KIVOReadFile(base + "/comm", &comm, 64) || comm.compare(0, 9, "entry.cgi") != 0) continue;
    std::string status;
    // The process may have ended since its name was read.
    if (!KIVOReadFile(base + "/status", &status, 4096)) continue;
    size_t at = status.find("VmHWM:");
    if (at != std::string::npos) peak = std::max(peak, std::atol(status.c_str() + at + 6));
  }
  if (proc) closedir(proc);
  return peak;
}

Json::Value ParseBody(const std::string& out) {
  Json::Value v;
  size_t at = out.find('{');
  if (at == std::string::npos) return v;
  Json::CharReaderBuilder b;
  std::string errors;
  std::unique_ptr<Json::CharReader> r(b.newCharReader());
  r->parse(out.data() + at, out.data() + out.size(), &v, &errors);
  return v;
}

}  // namespace

int main(int argc, char** argv) {
  uint64_t mib = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 1024;
  UseBuildDirOfThisProgram();
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  std::string src = root.Path("/tmp/src");
  MakeDirOrExit(src + "/package");
  WriteOrExit(src + "/INFO", "package=\"bench-upload\"\nversion=\"1.0\"\nstartable=\"no\"\n");
  uint64_t bytes = GeneratePayload(src + "/package", mib << 20);
  std::string pkg = root.Path("/tmp/bench.kpk"), error;
  BuildOptions options;
  options.compression_level = 1;
  if (!PMSBuildPackage(src, pkg, options, &error)) return fprintf(stderr, "%s\n", error.c_str()), 1;
  RunProgram({"rm", "-rf", src}, nullptr);
  struct stat st;
  stat(pkg.c_str(), &st);
  double file_mib = st.st_size / 1048576.0;
  printf("package: %.0f MiB file, %.0f MiB of files inside\n", file_mib, bytes / 1048576.0);

  RunProgram({"cat", pkg}, nullptr);  // into the page cache, as for the upload
  Clock::time_point t = Clock::now();
  RunProgram({"cp", pkg, root.Path("/volume1/copy.kpk")}, nullptr);
  double cp_s = Seconds(t);
  unlink(root.Path("/volume1/copy.kpk").c_str());

  WebServer server(root.dir());
  ApiClient admin("admin", "secret");
  std::string url = server.EntryURL();
  std::atomic<bool> done{false};
  std::atomic<long> peak{0};
  std::thread watcher([&] {
    while (!done) {
      peak = std::max(peak.load(), EntryCgiPeakKib());
      usleep(2000);
    }
  });
  std::string out;
  t = Clock::now();
  RunProgram(
      {"curl", "-s", "-F", "file=@" + pkg,
       url + "?api=KIVO.Core.Package.Installation&version=1&method=upload&_sid=" + admin.sid()},
      &out);
  double upload_s = Seconds(t);
  done = true;
  watcher.join();
  Json::Value up = ParseBody(out);
  if (!up["success"].asBool()) return fprintf(stderr, "upload failed: %s\n", out.c_str()), 1;

  // The same number of bytes that are not a package: stored, then refused
  // (4521) before any check, which times the transfer and store alone.
  std::string plain = root.Path("/tmp/plain.bin");
  RunProgram(
      {"sh", "-c", "head -c " + std::to_string(st.st_size) + " /dev/urandom > '" + plain + "'"},
      nullptr);
  RunProgram({"cat", plain}, nullptr);
  t = Clock::now();
  RunProgram(
      {"curl", "-s", "-F", "file=@" + plain,
       url + "?api=KIVO.Core.Package.Installation&version=1&method=upload&_sid=" + admin.sid()},
      &out);
  double store_s = Seconds(t);
  unlink(plain.c_str());

  t = Clock::now();
  RunProgram({"curl", "-s", "--data",
              "api=KIVO.Core.Package.Installation&version=1&method=install&_sid=" + admin.sid() +
                  "&task_id=" + up["data"]["task_id"].asString(),
              url},
             &out);
  double api_install_s = Seconds(t);
  if (!ParseBody(out)["success"].asBool())
    return fprintf(stderr, "install failed: %s\n", out.c_str()), 1;
  Kivoctl({"uninstall", "bench-upload"});
  t = Clock::now();
  Kivoctl({"install", pkg});
  double tool_install_s = Seconds(t);

  printf("%-34s %8s %10s\n", "", "seconds", "MiB/s");
  printf("%-34s %8.2f %10.0f\n", "cp of the package file", cp_s, file_mib / cp_s);
  printf("%-34s %8.2f %10.0f\n", "upload through lighttpd (+check)", upload_s, file_mib / upload_s);
  printf("%-34s %8.2f %10.0f\n", "upload through lighttpd, store only", store_s,
         file_mib / store_s);
  printf("upload speed relative to cp: %.2fx with the package check, %.2fx storing alone\n",
         cp_s / upload_s, cp_s / store_s);
  printf("%-34s %8.2f\n", "install through the web API", api_install_s);
  printf("%-34s %8.2f\n", "install by the package tool alone", tool_install_s);
  printf("entry.cgi peak RSS during the upload: %ld KiB\n", peak.load());
  return 0;
}
