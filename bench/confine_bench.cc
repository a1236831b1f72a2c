// What confinement costs: a start and a stop of a confined package (its own
// account, Landlock, its control groups) through the package tool against
// the same package with all of it turned off (package_confinement="off",
// package_cgroups="no"), turn about, with 10,000 files in its data folder
// as a package that has run a while holds (a confined start is timed after
// one that settled the folder, whose cost is printed apart); and the
// installed list of 300 packages that each have groups, with their usage
// (KIVO.Core.Package.Usage list beside the module's list, as the installed
// screen asks them: both at once, and the two one after the other for the
// work they take) against the list alone. Medians in ms. Run as root on a kernel with the
// controllers, or the "with" figures measure nothing.
//
//   confine_bench [start/stop rounds] [list rounds]     (default 40, 20)

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "bench_setup.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/registry.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

using Clock = std::chrono::steady_clock;

double Ms(Clock::time_point since) {
  return std::chrono::duration<double, std::milli>(Clock::now() - since).count();
}

double Median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v.empty() ? 0 : v[v.size() / 2];
}

void SetConfinement(const TempRoot& root, bool on) {
  WriteOrExit(
      root.Path("/etc/kivo/pkgtool.conf"),
      on ? "package_cgroups=\"yes\"\n" : "package_cgroups=\"no\"\npackage_confinement=\"off\"\n");
}

// One start and one stop of `id` through the package tool, each in ms.
struct StartStopMs {
  double start, stop;
};
StartStopMs StartStop(const std::string& id) {
  PackageManager pm;
  Clock::time_point t = Clock::now();
  Require(pm.serviceControl(0, id, true, "enu", "root", nullptr, false, false), "start " + id);
  const double start = Ms(t);
  t = Clock::now();
  Require(pm.serviceControl(0, id, false, "enu", "root", nullptr, false, false), "stop " + id);
  return {start, Ms(t)};
}

void BenchStartStop(int rounds) {
  TempRoot root;
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  const std::string dir = root.Path("/tmp/src");
  MakeDirOrExit(dir);
  // A service that ends at once on SIGTERM, so that the stop takes no
  // time of its own to blur the figures.
  TestPackage svc;
  svc.id = "bench-svc";
  svc.daemon = false;
  svc.info = {{"pidfile", "daemon.pid"}};
  svc.scripts = {{"start-stop-status",
                  "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
                  "case \"$1\" in\n"
                  "  start) sleep 1000 >/dev/null 2>&1 </dev/null & echo $! >\"$PIDFILE\" ;;\n"
                  "  stop) kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
                  "esac\n"}};
  InstallOrExit(svc.Build(dir));
  const std::string data = root.Path("/volume1/@appdata/bench-svc");
  for (int folder = 0; folder < 100; ++folder) {
    const std::string sub = data + "/d" + std::to_string(folder);
    MakeDirOrExit(sub);
    for (int file = 0; file < 100; ++file)
      WriteOrExit(sub + "/f" + std::to_string(file), std::string(1024, 'x'));
  }
  std::vector<double> start_with, start_without, stop_with, stop_without, first_start;
  for (int i = 0; i < rounds; ++i) {
    SetConfinement(root, true);
    // The scripts ran as root in the round before, and may have left files
    // of root's: the first confined start gives the whole data folder to
    // the package's account again, and every later one finds it settled.
    first_start.push_back(StartStop("bench-svc").start);
    StartStopMs with = StartStop("bench-svc");
    SetConfinement(root, false);
    StartStopMs without = StartStop("bench-svc");
    start_with.push_back(with.start);
    stop_with.push_back(with.stop);
    start_without.push_back(without.start);
    stop_without.push_back(without.stop);
  }
  SetConfinement(root, true);
  // What each script start adds in the tool: finding or making the groups,
  // setting the limits, opening them for the child.
  std::vector<double> prepare;
  for (int i = 0; i < rounds; ++i) {
    Clock::time_point t = Clock::now();
    const PackageCgroupJoin join = PackageCgroupPrepare("bench-svc", {64, 32});
    prepare.push_back(Ms(t));
  }
  const PackageUsage usage = PackageCgroupUsage("bench-svc");
  std::string problem;
  Require(PackageCgroupRemove("bench-svc", &problem), problem);
  printf(
      "median of %d: start confined %.2f ms, unconfined %.2f ms, difference %.2f ms; "
      "stop confined %.2f ms, unconfined %.2f ms, difference %.2f ms; preparing the groups "
      "%.3f ms per script; the first confined start after a start as root, which gives the "
      "10,000 files back to the package's account, %.2f ms%s\n",
      rounds, Median(start_with), Median(start_without), Median(start_with) - Median(start_without),
      Median(stop_with), Median(stop_without), Median(stop_with) - Median(stop_without),
      Median(prepare), Median(first_start),
      usage.process_limit.measured ? "" : " (groups not applied: no controller or not root)");
}

// The installed screen's list call: the fields its rows show.
const Params kInstalledScreenList = {
    {"additional",
     R"(["status","startable","is_uninstall_pages","beta","installing_progress","url"])"}};

void BenchList(int rounds) {
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  const std::string dir = root.Path("/tmp/src");
  MakeDirOrExit(dir);
  for (int i = 0; i < 300; ++i) {
    TestPackage p = PackageWithInfo("bench-" + std::to_string(i), {{"description", "Bench"}});
    InstallOrExit(p.Build(dir));
    // Groups as a start makes them, so that usage has something to read.
    const PackageCgroupJoin groups = PackageCgroupPrepare(p.id, {64, 32});
    if (i == 0 && !groups.missing().empty())
      printf("groups not applied: %s", groups.missing().c_str());
  }
  ApiClient admin("admin", "secret");
  ApiClient second("admin", "secret");
  Require(admin.signed_in() && second.signed_in(), "sign-in");
  auto list = [&admin] {
    Require(admin.Call("KIVO.Core.Package", "list", 1, kInstalledScreenList).Success(), "list");
  };
  auto usage = [&second] {
    Require(second.Call("KIVO.Core.Package.Usage", "list", 1).Success(), "usage");
  };
  std::vector<double> alone, bare, serial, together, one;
  for (int i = 0; i < rounds; ++i) {
    Clock::time_point t = Clock::now();
    list();
    alone.push_back(Ms(t));
    t = Clock::now();
    Require(admin.Call("KIVO.Core.Package", "list", 1).Success(), "bare list");
    bare.push_back(Ms(t));
    // The work of both, one after the other: what the appliance spends.
    t = Clock::now();
    list();
    usage();
    serial.push_back(Ms(t));
    // Both at once, as the installed screen sends them: what its user
    // waits for on a machine with a core for each.
    t = Clock::now();
    std::thread beside(usage);
    list();
    beside.join();
    together.push_back(Ms(t));
    // What any request costs before it reads a package: the floor under
    // the usage list's own share.
    t = Clock::now();
    Require(admin.Call("KIVO.Core.Package.Usage", "get", 1, {{"id", "bench-0"}}).Success(), "get");
    one.push_back(Ms(t));
  }
  for (const std::string& id : PackageRegistry::List()) {
    std::string problem;
    Require(PackageCgroupRemove(id, &problem), problem);
  }
  const double base = Median(alone);
  printf(
      "list of 300 as the installed screen asks it, median of %d: list %.1f ms (%.1f ms without "
      "its additional fields); list and usage one after the other %.1f ms, ratio %.2f; both at "
      "once, as the page sends them, %.1f ms, ratio %.2f; usage of one package %.1f ms\n",
      rounds, base, Median(bare), Median(serial), Median(serial) / base, Median(together),
      Median(together) / base, Median(one));
}

}  // namespace

int main(int argc, char** argv) {
  const int rounds = argc > 1 ? std::max(1, atoi(argv[1])) : 40;
  const int list_rounds = argc > 2 ? std::max(1, atoi(argv[2])) : 20;
  UseBuildDirOfThisProgram();
  BenchStartStop(rounds);
  BenchList(list_rounds);
  return 0;
}
