// The watchdog's cost while nothing dies: `kivoctl watchdog` on a root with
// N installed packages, each running (a service tracked by its pid file),
// measured from its process's CPU time (/proc/<pid>/stat) over a stretch of
// checks, at a check every second and at the default interval; and the
// wall time of one check of them all (`kivoctl watchdog --once`, the
// process's start included).
//
//   watchdog_bench [packages] [seconds at the default interval]
//                  (default 300, 90)

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "bench_setup.h"
#include "klibc/atomic_file.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/watchdog_record.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

using Clock = std::chrono::steady_clock;

// A service that costs nothing while it runs: one sleeping process.
const char kIdleService[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "case \"$1\" in\n"
    "  start) sleep 100000 </dev/null >/dev/null 2>&1 &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) [ -f \"$PIDFILE\" ] && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
    "  status) [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null ;;\n"
    "esac\n";

void InstallRunning(const std::string& dir, int count) {
  for (int i = 0; i < count; ++i) {
    TestPackage p;
    p.id = "bench-" + std::to_string(i);
    p.daemon = false;
    p.info = {{"pidfile", "daemon.pid"}, {"logfile", "app.log"}};
    p.scripts = {{"start-stop-status", kIdleService}};
    const std::string file = p.Build(dir);
    std::string message;
    PKG_ERRCODE code;
    Json::Value details;
    Require(InstallPackageFileImpl("root", file, "", 0, "", true, "enu", message, code, details,
                                   true, false),
            "install of " + file + ": " + message);
    unlink(file.c_str());
  }
}

// The user and system CPU time of process `pid`, in seconds.
double CpuSeconds(pid_t pid) {
  std::string stat;
  Require(KIVOReadFile("/proc/" + std::to_string(pid) + "/stat", &stat, 4096), "read its stat");
  // Fields after the command's closing parenthesis: utime is the 12th.
  std::string rest = stat.substr(stat.rfind(')') + 2);
  std::vector<std::string> fields;
  for (size_t at = 0; at < rest.size();) {
    size_t end = rest.find(' ', at);
    if (end == std::string::npos) end = rest.size();
    fields.push_back(rest.substr(at, end - at));
    at = end + 1;
  }
  Require(fields.size() > 13, "parse its stat");
  return (std::stod(fields[11]) + std::stod(fields[12])) / sysconf(_SC_CLK_TCK);
}

pid_t StartWatchdog() {
  const std::string program = BuildDir() + "/bin/kivoctl";
  pid_t pid = fork();
  if (pid == 0) {
    execl(program.c_str(), program.c_str(), "watchdog", nullptr);
    _exit(127);
  }
  Require(pid > 0, "start the watchdog");
  return pid;
}

void StopWatchdog(pid_t pid) {
  kill(pid, SIGTERM);
  int status = 0;
  waitpid(pid, &status, 0);
  Require(WIFEXITED(status) && WEXITSTATUS(status) == 0, "the watchdog ended well");
}

// The watchdog's CPU use, in percent of one core, over `seconds` after its
// first check (the process's start is not what is measured).
double IdleCpuPercent(const TempRoot& root, int interval, int seconds) {
  WriteOrExit(root.Path("/etc/kivo/watchdog.conf"),
              "interval_seconds=\"" + std::to_string(interval) + "\"\n");
  pid_t pid = StartWatchdog();
  sleep(2);
  const double cpu0 = CpuSeconds(pid);
  const auto t0 = Clock::now();
  sleep(static_cast<unsigned>(seconds));
  const double cpu = CpuSeconds(pid) - cpu0;
  const double wall = std::chrono::duration<double>(Clock::now() - t0).count();
  StopWatchdog(pid);
  return 100.0 * cpu / wall;
}

}  // namespace

int main(int argc, char** argv) {
  UseBuildDirOfThisProgram();
  const int count = argc > 1 ? std::atoi(argv[1]) : 300;
  const int seconds = argc > 2 ? std::atoi(argv[2]) : 90;
  Require(count > 0 && seconds > 0, "usage: watchdog_bench [packages] [seconds]");
  TempRoot root;
  PackageManager pm;
  Require(pm.init(), "registry");
  // The benchmark's packages are unsigned.
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  const std::string dir = root.Path("/bench-packages");
  MakeDirOrExit(dir);
  printf("installing and starting %d packages...\n", count);
  InstallRunning(dir, count);

  std::vector<double> once_ms;
  for (int i = 0; i < 7; ++i) {
    const auto t0 = Clock::now();
    std::string out;
    Require(Kivoctl({"watchdog", "--once"}, &out) == 0 && out.empty(), "one quiet check: " + out);
    once_ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
  }
  std::sort(once_ms.begin(), once_ms.end());
  printf(
      "one check of %d running packages (kivoctl watchdog --once, start included): "
      "median %.1f ms, max %.1f ms\n",
      count, once_ms[once_ms.size() / 2], once_ms.back());

  const int every_second = std::min(seconds, 30);
  printf("idle CPU, a check every second, over %d s: %.3f%% of one core\n", every_second,
         IdleCpuPercent(root, 1, every_second));
  const int interval = WatchdogSettings().interval_seconds;
  printf(
      "idle CPU, a check every %d s (the default), over %d s: %.3f%% of one core "
      "(target: under 1%%)\n",
      interval, seconds, IdleCpuPercent(root, interval, seconds));
  StopInstalledPackages();
  return 0;
}
