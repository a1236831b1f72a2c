// Each package in a control group of its own, through the real tool and the
// real host on temporary roots: a package that takes memory without end is
// killed inside its group, a fork bomb stops at the process limit, limits
// above the appliance's bounds are refused, and the usage the host answers
// is measured or says why not.

#include "pkgtool/package_cgroup.h"

#include <algorithm>
#include <dirent.h>
#include <signal.h>
#include <sstream>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/writer.h>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/admin_api_test.h"
#include "testing/package_factory.h"

namespace {

constexpr char kUsage[] = "KIVO.Core.Package.Usage";

// A service that keeps doubling a string until something stops it.
const char kHogScript[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "case \"$1\" in\n"
    "  start) sh -c 'a=x; while :; do a=\"$a$a\"; done' >/dev/null 2>&1 </dev/null &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) kill \"$(cat \"$PIDFILE\")\" 2>/dev/null; rm -f \"$PIDFILE\" ;;\n"
    "  status) [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null ;;\n"
    "esac\n";

// A service that starts 200 processes that stay for a while, or as many as
// it is let.
const char kBombScript[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "case \"$1\" in\n"
    "  start) sh -c 'i=0; while [ $i -lt 200 ]; do sleep 60 & i=$((i+1)); done; wait' "
    ">/dev/null 2>&1 </dev/null &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) kill \"$(cat \"$PIDFILE\")\" 2>/dev/null; rm -f \"$PIDFILE\" ;;\n"
    "  status) [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null ;;\n"
    "esac\n";

class PackageCgroupTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);  // unsigned test packages; signatures have tests of their own
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  }
  // TempRoot removes the root's groups with it.
  void TearDown() override { StopInstalledPackages(); }

  // Skips the test unless it runs as root on a kernel with the memory and
  // pids controllers, judged by the usage of a package that ran.
  bool Confinable(const std::string& id) {
    if (geteuid() != 0) {
      skip_ = "needs root to make control groups";
      return false;
    }
    Json::Value usage = client().Call(kUsage, "get", 1, {{"id", id}}).Data();
    for (const char* f : {"memory_limit_bytes", "process_limit"}) {
      if (!usage[f]["measured"].asBool()) {
        skip_ = std::string(f) + " not measured: " + usage[f]["reason"].asString();
        return false;
      }
    }
    return true;
  }

  // The group folders the tool recorded for `id`.
  std::vector<std::string> GroupDirs(const std::string& id) {
    std::vector<std::string> dirs;
    std::istringstream in(FileText(root_.Path("/run/kivo/pkgtool/cgroups/" + id)));
    // "<what> v1|v2 <dir> <bound>" lines.
    std::string what, kind, dir, bound;
    while (in >> what >> kind >> dir >> bound) dirs.push_back(dir);
    return dirs;
  }
  // The group folder of `id` that has `file`.
  std::string GroupWith(const std::string& id, const std::string& file) {
    for (const std::string& dir : GroupDirs(id)) {
      if (access((dir + "/" + file).c_str(), F_OK) == 0) return dir;
    }
    return "";
  }

  int Install(const TestPackage& p, bool run = true) {
    std::vector<std::string> args = {"install", p.Build(dir_)};
    if (run) args.push_back("--run");
    return Kivoctl(args, &out_);
  }
  TestPackage Service(const std::string& id, const char* script,
                      const std::map<std::string, std::string>& info) {
    TestPackage p;
    p.id = id;
    p.daemon = false;
    p.info = info;
    p.info["pidfile"] = "daemon.pid";
    p.scripts = {{"start-stop-status", script}};
    return p;
  }
  // The pid the service of `id` wrote, 0 when none.
  pid_t ServicePid(const std::string& id) {
    return static_cast<pid_t>(
        std::atol(FileText(root_.Path("/var/packages/" + id + "/var/daemon.pid")).c_str()));
  }
  // The appliance still answers and `id` still runs and is measured.
  void ExpectApplianceAndOtherPackageWork(const std::string& id) {
    CgiAnswer list = client().Call(kUsage, "list", 1);
    ASSERT_TRUE(list.Success()) << list.body;
    EXPECT_EQ(2u, list.Data()["total"].asUInt()) << list.body;
    std::string status;
    EXPECT_EQ(0, Kivoctl({"status", id}, &status));
    EXPECT_EQ(id + " 1.0 running\n", status);
    Json::Value usage = client().Call(kUsage, "get", 1, {{"id", id}}).Data();
    EXPECT_TRUE(usage["memory_bytes"]["measured"].asBool()) << usage;
    EXPECT_TRUE(usage["cpu_ns"]["measured"].asBool()) << usage;
  }

  std::string dir_;
  std::string out_;
  std::string skip_;
};

#define SKIP_UNLESS_CONFINABLE(id) \
  if (!Confinable(id)) GTEST_SKIP() << skip_

// "<key> <n>" of a control file such as memory.oom_control or pids.events.
long Counter(const std::string& file, const std::string& key) {
  std::istringstream in(FileText(file));
  std::string k;
  long v = 0;
  while (in >> k >> v) {
    if (k == key) return v;
  }
  return -1;
}

TEST_F(PackageCgroupTest, MemoryHogIsKilledInsideItsGroupAndTheRestKeepsWorking) {
  ASSERT_EQ(0, Install(PackageWithInfo("calm"))) << out_;
  ASSERT_EQ(0, Install(Service("hog", kHogScript, {{"memory_limit_mb", "32"}}))) << out_;
  SKIP_UNLESS_CONFINABLE("hog");
  Json::Value usage = client().Call(kUsage, "get", 1, {{"id", "hog"}}).Data();
  EXPECT_EQ(32u << 20, usage["memory_limit_bytes"]["value"].asUInt64()) << usage;

  const pid_t hog = ServicePid("hog");
  ASSERT_GT(hog, 0);
  // The kernel ends it once it reaches 32 MiB; a generous bound for a busy
  // machine, ended early as soon as it is gone.
  for (int i = 0; i < 600 && kill(hog, 0) == 0; ++i) usleep(50000);
  EXPECT_NE(0, kill(hog, 0)) << "the hog still runs";
  const std::string memory = GroupWith("hog", "memory.events");
  const std::string v1 = GroupWith("hog", "memory.oom_control");
  const long kills = !memory.empty() ? Counter(memory + "/memory.events", "oom_kill")
                                     : Counter(v1 + "/memory.oom_control", "oom_kill");
  EXPECT_GE(kills, 1) << "not killed by its group's memory bound";

  ExpectApplianceAndOtherPackageWork("calm");
}

// The script is in every group of its package before its first command:
// the service that command starts is in each of them, whatever way the tool
// joins the groups (on v1 thread by thread, and the whole process moves).
TEST_F(PackageCgroupTest, ScriptAndItsServiceAreInEveryGroupFromTheFirstCommand) {
  const char script[] =
      "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
      "case \"$1\" in\n"
      "  start) sleep 60 >/dev/null 2>&1 </dev/null & echo $! >\"$PIDFILE\" ;;\n"
      "  stop) kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
      "  status) [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null ;;\n"
      "esac\n";
  ASSERT_EQ(0, Install(Service("placed", script, {}))) << out_;
  SKIP_UNLESS_CONFINABLE("placed");
  const std::vector<std::string> dirs = GroupDirs("placed");
  ASSERT_FALSE(dirs.empty());
  const pid_t service = ServicePid("placed");
  ASSERT_GT(service, 0);
  for (const std::string& dir : dirs) {
    std::istringstream procs(FileText(dir + "/cgroup.procs"));
    std::vector<pid_t> in;
    for (long pid = 0; procs >> pid;) in.push_back(static_cast<pid_t>(pid));
    EXPECT_NE(in.end(), std::find(in.begin(), in.end(), service)) << dir;
  }

  // A root about to be removed drops its groups, killing the service;
  // the running system's groups are never dropped so.
  EXPECT_EQ(2, Kivoctl({"drop-groups"}, &out_, {{"KIVO_ROOT", ""}})) << out_;
  EXPECT_NE(std::string::npos, out_.find("never the running system")) << out_;
  ASSERT_EQ(0, Kivoctl({"drop-groups"}, &out_)) << out_;
  for (const std::string& dir : dirs) EXPECT_NE(0, access(dir.c_str(), F_OK)) << dir;
  // Gone, or dead and waiting for whoever adopted it to reap it.
  std::string stat;
  const bool ended = !KIVOReadFile("/proc/" + std::to_string(service) + "/stat", &stat) ||
                     stat.find(") Z ") != std::string::npos;
  EXPECT_TRUE(ended) << "the service outlived its groups: " << stat;
}

TEST_F(PackageCgroupTest, ForkBombStopsAtTheProcessLimit) {
  ASSERT_EQ(0, Install(PackageWithInfo("calm"))) << out_;
  ASSERT_EQ(0, Install(Service("bomb", kBombScript, {{"process_limit", "16"}}))) << out_;
  SKIP_UNLESS_CONFINABLE("bomb");
  const std::string pids = GroupWith("bomb", "pids.max");
  ASSERT_FALSE(pids.empty());
  EXPECT_EQ("16\n", FileText(pids + "/pids.max"));
  // The limit refused forks, and never more than 16 processes ran.
  for (int i = 0; i < 600 && Counter(pids + "/pids.events", "max") < 1; ++i) usleep(50000);
  EXPECT_GE(Counter(pids + "/pids.events", "max"), 1) << "no fork was refused";
  EXPECT_LE(std::atol(FileText(pids + "/pids.current").c_str()), 16);

  ExpectApplianceAndOtherPackageWork("calm");

  // Uninstall ends what the bomb left and removes its groups.
  const std::vector<std::string> dirs = GroupDirs("bomb");
  ASSERT_EQ(0, Kivoctl({"uninstall", "bomb"}, &out_)) << out_;
  for (const std::string& dir : dirs) EXPECT_NE(0, access(dir.c_str(), F_OK)) << dir;
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/run/kivo/pkgtool/cgroups/bomb").c_str()));
}

TEST_F(PackageCgroupTest, LimitsAboveTheBoundsAreRefusedAndWithinThemApplied) {
  root_.Write("/etc/kivo/pkgtool.conf",
              "memory_limit_mb_max=\"64\"\nprocess_limit_max=\"50\"\n"
              "memory_limit_mb_default=\"100\"\nprocess_limit_default=\"20\"\n");
  EXPECT_EQ(1, Install(PackageWithInfo("big", {{"memory_limit_mb", "65"}}), false));
  EXPECT_NE(std::string::npos, out_.find("[315]")) << out_;
  EXPECT_NE(std::string::npos, out_.find("memory_limit_mb: 65 is above")) << out_;
  EXPECT_EQ(1, Install(PackageWithInfo("many", {{"process_limit", "51"}}), false));
  EXPECT_NE(std::string::npos, out_.find("[315]")) << out_;
  EXPECT_FALSE(PackageRegistry::IsInstalled("big"));
  EXPECT_FALSE(PackageRegistry::IsInstalled("many"));

  // At the bound it installs; a default above the bound is lowered to it.
  ASSERT_EQ(0, Install(PackageWithInfo("edge", {{"process_limit", "50"}}))) << out_;
  SKIP_UNLESS_CONFINABLE("edge");
  Json::Value usage = client().Call(kUsage, "get", 1, {{"id", "edge"}}).Data();
  EXPECT_EQ(50u, usage["process_limit"]["value"].asUInt()) << usage;
  EXPECT_EQ(64u << 20, usage["memory_limit_bytes"]["value"].asUInt64()) << usage;

  // A bound lowered later holds from the next start, and the usage says so
  // as the kernel does.
  root_.Write("/etc/kivo/pkgtool.conf", "memory_limit_mb_max=\"48\"\nprocess_limit_max=\"40\"\n");
  ASSERT_EQ(0, Kivoctl({"stop", "edge"}, &out_)) << out_;
  ASSERT_EQ(0, Kivoctl({"start", "edge"}, &out_)) << out_;
  usage = client().Call(kUsage, "list", 1).Data()["packages"][0];
  EXPECT_EQ(40u, usage["process_limit"]["value"].asUInt()) << usage;
  EXPECT_EQ(48u << 20, usage["memory_limit_bytes"]["value"].asUInt64()) << usage;
  EXPECT_EQ("40\n", FileText(GroupWith("edge", "pids.max") + "/pids.max"));
}

TEST_F(PackageCgroupTest, UsageOfAPackageThatNeverRanIsNotMeasuredAndSaysWhy) {
  ASSERT_EQ(0, Install(PackageWithInfo("idle"), false)) << out_;
  CgiAnswer got = client().Call(kUsage, "get", 1, {{"id", "idle"}});
  ASSERT_TRUE(got.Success()) << got.body;
  for (const char* f : {"cpu_ns", "memory_bytes", "memory_limit_bytes", "process_limit"}) {
    const Json::Value& figure = got.Data()[f];
    EXPECT_FALSE(figure["measured"].asBool()) << got.body;
    EXPECT_FALSE(figure.isMember("value")) << got.body;
    EXPECT_FALSE(figure["reason"].asString().empty()) << got.body;
  }
  EXPECT_EQ(4616, client().Call(kUsage, "get", 1, {{"id", "absent"}}).Code());
  EXPECT_EQ(120, client().Call(kUsage, "get", 1, {{"id", "../etc"}}).Code());
  // Administrators only, as every package API.
  root_.AddAccount("user", "secret", {"users"});
  ApiClient user("user", "secret");
  ASSERT_TRUE(user.signed_in());
  EXPECT_EQ(105, user.Call(kUsage, "list", 1).Code());
}

}  // namespace
