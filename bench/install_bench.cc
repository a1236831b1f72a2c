// Installs a package whose payload is generated files of mixed sizes
// (default 1 GiB) and prints the time next to `tar -xzf` of the very same
// package.tgz into the same volume, and the package tool's peak memory.
//
//   install_bench [payload MiB]

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "bench_setup.h"
#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "testing/payload_generator.h"
#include "testing/temp_root.h"

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::time_point since) {
  return std::chrono::duration<double>(Clock::now() - since).count();
}

// Runs a command, returns seconds taken and the peak RSS in KiB.
double Run(const std::vector<std::string>& argv, long* peak_kib) {
  Clock::time_point start = Clock::now();
  pid_t pid = fork();
  if (pid == 0) {
    int null = open("/dev/null", O_WRONLY);
    dup2(null, STDOUT_FILENO);
    std::vector<char*> args;
    for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    execvp(args[0], args.data());
    _exit(127);
  }
  int status = 0;
  struct rusage usage;
  wait4(pid, &status, 0, &usage);
  if (peak_kib) *peak_kib = usage.ru_maxrss;
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    fprintf(stderr, "%s failed\n", argv[0].c_str());
    exit(1);
  }
  return Seconds(start);
}

}  // namespace

int main(int argc, char** argv) {
  uint64_t mib = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 1024;
  UseBuildDirOfThisProgram();
  TempRoot root;
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  std::string src = root.Path("/tmp/src");
  MakeDirOrExit(src + "/package");
  WriteOrExit(src + "/INFO", "package=\"bench-payload\"\nversion=\"1.0\"\nstartable=\"no\"\n");
  Clock::time_point t = Clock::now();
  uint64_t bytes = GeneratePayload(src + "/package", mib << 20);
  printf("payload: %.0f MiB in generated files (%.1f s)\n", bytes / 1048576.0, Seconds(t));

  std::string pkg = root.Path("/tmp/bench.kpk"), error;
  BuildOptions options;
  options.compression_level = 1;
  t = Clock::now();
  if (!PMSBuildPackage(src, pkg, options, &error)) {
    fprintf(stderr, "build failed: %s\n", error.c_str());
    return 1;
  }
  printf("package built with gzip level 1 (%.1f s)\n", Seconds(t));
  std::string work = root.Path("/tmp/work");
  MakeDirOrExit(work);
  Run({"tar", "-xf", pkg, "-C", work, "package.tgz"}, nullptr);
  Run({"rm", "-rf", src}, nullptr);
  Run({"cat", pkg, work + "/package.tgz"}, nullptr);  // both start from the page cache

  std::string tar_target = root.Path("/volume1/tar-target");
  MakeDirOrExit(tar_target);
  long tar_kib = 0, tool_kib = 0;
  double tar_s = Run({"tar", "-xzf", work + "/package.tgz", "-C", tar_target}, &tar_kib);
  Run({"rm", "-rf", tar_target}, nullptr);
  Run({"sync"}, nullptr);
  double tool_s = Run({BuildDir() + "/bin/kivoctl", "install", pkg}, &tool_kib);

  printf("%-28s %8s %10s %12s\n", "", "seconds", "MiB/s", "peak RSS");
  printf("%-28s %8.2f %10.0f %9ld KiB\n", "tar -xzf package.tgz", tar_s, bytes / 1048576.0 / tar_s,
         tar_kib);
  printf("%-28s %8.2f %10.0f %9ld KiB\n", "kivoctl install", tool_s, bytes / 1048576.0 / tool_s,
         tool_kib);
  printf("speed of the tool relative to tar: %.2fx\n", tar_s / tool_s);
  return 0;
}
