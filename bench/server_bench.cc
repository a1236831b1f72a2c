// Package server figures:
//  1. "Server" "list" through lighttpd for catalogues of 500 and 2,000
//     entries merged with 300 installed packages, from the cache and with
//     "blforcereload" (p50, p99, and the cost per entry);
//  2. the download of a 1 GiB package from a loopback lighttpd by the
//     download worker (md5 and sha256 checked) against `curl -o` of the same
//     file, and the worker's peak memory for 64 MiB and 1 GiB.
//
//   server_bench [requests per case] [download MiB] [list|download]
//   (default 20, 1024, both). SERVER_BENCH_ENTRY names a program lighttpd
//   runs instead of the build's entry.cgi (a profiler wrapped around it).
//   SERVER_BENCH_ANSWERS names a folder that receives each case's answer
//   body (list-<entries>-<cached|reload>.json), to compare two builds'
//   answers byte for byte.

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "bench_setup.h"
#include "klibc/atomic_file.h"
#include "pkgserver/download.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "taskmgr/task.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

namespace {

using Clock = std::chrono::steady_clock;

double Ms(Clock::time_point since) {
  return std::chrono::duration<double, std::milli>(Clock::now() - since).count();
}

void InstallMany(const std::string& dir, int count) {
  for (int i = 0; i < count; ++i) {
    TestPackage p;
    p.id = "bench-" + std::to_string(i);
    p.daemon = false;
    p.info = {{"adminport", "18000"}, {"checkport", "no"}};
    InstallOrExit(p.Build(dir));
  }
}

// A catalogue of `entries` packages; the first ones are the installed
// bench-N at a newer version.
std::string Catalogue(int entries) {
  std::string out = "{\"packages\": [";
  for (int i = 0; i < entries; ++i) {
    std::string id = "bench-" + std::to_string(i);
    out += std::string(i ? "," : "") + "{\"package\": \"" + id +
           "\", \"version\": \"2.0\", \"dname\": \"Bench " + std::to_string(i) +
           "\", \"desc\": \"A package of the benchmark catalogue with a description of "
           "ordinary length.\", \"link\": \"http://127.0.0.1/feed/" +
           id +
           ".kpk\", \"md5\": \"0123456789abcdef0123456789abcdef\", \"size\": 123456, "
           "\"deppkgs\": \"bench-0>=1.0\", \"conflictpkgs\": \"\", \"beta\": false}";
  }
  return out + "], \"recommend\": [\"bench-1\", \"bench-2\"], \"keyrings\": []}";
}

struct Percentiles {
  double p50, p99;
};

// Keeps the answer body of one case when SERVER_BENCH_ANSWERS asks for it.
void KeepAnswer(const std::string& response, const std::string& name) {
  const char* folder = getenv("SERVER_BENCH_ANSWERS");
  size_t body = response.find("\r\n\r\n");
  if (!folder || body == std::string::npos) return;
  WriteOrExit(std::string(folder) + "/" + name, response.substr(body + 4));
}

Percentiles Time(int port, const std::string& target, const std::string& headers, int n,
                 const std::string& name) {
  LoopbackGet(port, target, headers);  // warm-up (and the first fetch)
  std::vector<double> ms;
  for (int r = 0; r < n; ++r) {
    Clock::time_point t = Clock::now();
    LoopbackGet(port, target, headers);
    ms.push_back(Ms(t));
  }
  // The answer kept is one after the timed ones.
  KeepAnswer(LoopbackExchange(
                 port, "GET " + target + " HTTP/1.0\r\nHost: 127.0.0.1\r\n" + headers + "\r\n"),
             name);
  std::sort(ms.begin(), ms.end());
  return {ms[ms.size() / 2], ms[std::min(ms.size() - 1, ms.size() * 99 / 100)]};
}

void ListFigures(int requests) {
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  std::string dir = root.Path("/tmp/src");
  MakeDirOrExit(dir);
  InstallMany(dir, 300);
  ApiClient admin("admin", "secret");
  const char* entry = getenv("SERVER_BENCH_ENTRY");
  WebServer server(root.dir(), entry ? entry : "");
  const std::string headers =
      "Cookie: id=" + admin.sid() + "\r\nX-KIVO-Token: " + admin.token() + "\r\n";
  const std::string target = "/webapi/entry.cgi?api=KIVO.Core.Package.Server&version=1&method=list";
  printf("Server list, 300 installed packages, through lighttpd\n");
  printf("%8s %14s %14s %14s %14s %16s\n", "entries", "cached p50", "cached p99", "reload p50",
         "reload p99", "cached ms/entry");
  for (int entries : {500, 2000}) {
    // A file of its own per case: the web server may serve a replaced file's
    // old content for a while.
    const std::string file = "catalogue-" + std::to_string(entries) + ".json";
    root.Write("/usr/kivo/www/feed/" + file, Catalogue(entries));
    root.Write("/etc/kivo/pkgserver.conf",
               "vendor_url=\"http://127.0.0.1:" + std::to_string(server.port()) + "/feed/" + file +
                   "\"\n"
                   "catalogue_max_age=\"3600\"\n");
    const std::string label = "list-" + std::to_string(entries);
    Percentiles reload = Time(server.port(), target + "&blforcereload=true", headers, requests,
                              label + "-reload.json");
    Percentiles cached = Time(server.port(), target, headers, requests, label + "-cached.json");
    printf("%8d %11.1f ms %11.1f ms %11.1f ms %11.1f ms %16.4f\n", entries, cached.p50, cached.p99,
           reload.p50, reload.p99, cached.p50 / entries);
    fflush(stdout);
  }
}

std::string Digest(const char* tool, const std::string& path) {
  std::string out;
  RunProgram({tool, path}, &out);
  return out.substr(0, out.find(' '));
}

// Runs one download in a child (as the worker does) and reports its time
// and peak memory.
void WorkerDownload(const std::string& url, const std::string& md5, const char* label) {
  int fds[2];
  if (pipe(fds) != 0) return;
  fflush(stdout);  // the child must not print the parent's buffered lines again
  Clock::time_point t = Clock::now();
  pid_t pid = fork();
  if (pid == 0) {
    std::string folder;
    std::unique_ptr<NVX::Task> task(GetNewTask("@administrators", "@KIVOPKG_DOWNLOAD_bigpkg"));
    bool ok =
        PMSCreateDownloadTmpDir("", "bigpkg", 0, folder) &&
        KIVOPackageServer::InitDownload(task.get(), "bigpkg", 0, url, folder, false, getpid());
    std::string path;
    ok = ok && KIVOPackageServer::DownloadPackage(task.get(), "root", "bigpkg", url, md5, false,
                                                  folder, "enu", path);
    if (!ok)
      fprintf(stderr, "download failed: %s\n", task->getProperty("data").toStyledString().c_str());
    KIVOPackageServer::PMSRemoveDownloadDir(folder);
    _exit(ok ? 0 : 1);
  }
  int status = 0;
  struct rusage usage;
  wait4(pid, &status, 0, &usage);
  double ms = Ms(t);
  double cpu_ms = (usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1e3 +
                  (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e3;
  printf("%-28s %9.0f ms  cpu %6.0f ms  peak memory %6.1f MiB%s\n", label, ms, cpu_ms,
         usage.ru_maxrss / 1024.0,
         WIFEXITED(status) && WEXITSTATUS(status) == 0 ? "" : "  (FAILED)");
  close(fds[0]);
  close(fds[1]);
}

void DownloadFigures(int mib) {
  TempRoot root;
  WebServer server(root.dir());
  const std::string feed = root.Path("/usr/kivo/www/feed");
  MakeDirOrExit(feed);
  const std::string big = feed + "/bigpkg.kpk", small = feed + "/smallpkg.kpk";
  RunProgram({"sh", "-c",
              "head -c " + std::to_string(mib) + "M /dev/urandom > " + big + " && head -c 64M " +
                  big + " > " + small},
             nullptr);
  const std::string base = "http://127.0.0.1:" + std::to_string(server.port()) + "/feed/";
  const std::string md5 = Digest("md5sum", big), sha256 = Digest("sha256sum", big);
  root.Write("/usr/kivo/www/feed/catalogue.json",
             "[{\"package\": \"bigpkg\", \"version\": \"1.0\", \"link\": \"" + base +
                 "bigpkg.kpk\", \"md5\": \"" + md5 + "\", \"sha256\": \"" + sha256 + "\"}]");
  root.Write("/etc/kivo/pkgserver.conf", "vendor_url=\"" + base + "catalogue.json\"\n");
  printf("\nDownload of %d MiB from lighttpd on loopback\n", mib);
  RunProgram({"cat", big}, nullptr);  // the file in the page cache for both
  Clock::time_point t = Clock::now();
  RunProgram({"curl", "-s", "-o", root.Path("/volume1/curl.out"), base + "bigpkg.kpk"}, nullptr);
  double curl_ms = Ms(t);
  unlink(root.Path("/volume1/curl.out").c_str());
  printf("%-28s %9.0f ms\n", "curl -o", curl_ms);
  WorkerDownload(base + "bigpkg.kpk", md5, "worker (md5 + sha256)");
  WorkerDownload(base + "smallpkg.kpk", "", "worker, 64 MiB, no digest");
}

}  // namespace

int main(int argc, char** argv) {
  int requests = argc > 1 ? std::max(1, atoi(argv[1])) : 20;
  int mib = argc > 2 ? std::max(64, atoi(argv[2])) : 1024;
  const std::string only = argc > 3 ? argv[3] : "";
  UseBuildDirOfThisProgram();
  if (only != "download") ListFigures(requests);
  if (only != "list") DownloadFigures(mib);
  return 0;
}
