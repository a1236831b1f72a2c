// Start, stop, the feasibility check and uninstall through the real host,
// on packages installed by the package tool.

#include <dirent.h>
#include <memory>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class ControlTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);
    dir_ = root_.Path("/tmp/packages");
    // The packages here write one file they share, to show the order of a
    // batch; confined, each reaches only its own folders.
    root_.Write("/etc/kivo/pkgtool.conf", "script_timeout=\"120\"\npackage_confinement=\"off\"\n");
  }
  void TearDown() override { StopInstalledPackages(); }

  // A package whose start and stop append its id to one shared file, so the
  // order of a batch shows.
  void Install(const std::string& id, const std::string& deps = "", bool run = false,
               bool fail_start = false) {
    TestPackage p;
    p.id = id;
    p.daemon = false;
    if (!deps.empty()) p.info = {{"install_dep_packages", deps}};
    p.info["pidfile"] = "pid";
    p.scripts = {
        {"start-stop-status",
         "case \"$1\" in\n"
         "start) " +
             std::string(fail_start ? "echo 'start refused' >&2; exit 1;;\n"
                                    : "echo start-$KIVO_PKG_NAME >> \"$KIVO_ROOT/tmp/order\"\n"
                                      "  echo \"$KIVO_PKG_NAME started\" >> \"$KIVO_WORKER_MSG\"\n"
                                      "  sleep 60 >/dev/null 2>&1 </dev/null & echo $! > "
                                      "\"$KIVO_PKG_VAR/pid\";;\n") +
             "stop) echo stop-$KIVO_PKG_NAME >> \"$KIVO_ROOT/tmp/order\"\n"
             "  kill $(cat \"$KIVO_PKG_VAR/pid\") 2>/dev/null; rm -f \"$KIVO_PKG_VAR/pid\";;\n"
             "status) [ -f \"$KIVO_PKG_VAR/pid\" ] && kill -0 $(cat \"$KIVO_PKG_VAR/pid\");;\n"
             "esac\n"}};
    std::vector<std::string> args = {"install", p.Build(dir_)};
    if (run) args.push_back("--run");
    std::string out;
    ASSERT_EQ(0, Kivoctl(args, &out)) << out;
  }
  CgiAnswer Call(const std::string& api, const std::string& method, const Params& params) {
    return client().Call(api, method, 1, params);
  }
  std::string Order() {
    std::string text;
    if (!KIVOReadFile(root_.Path("/tmp/order"), &text)) return "";
    unlink(root_.Path("/tmp/order").c_str());
    return text;
  }
  // Operation logs left in the tool's log folder.
  int OperationLogs() {
    int n = 0;
    DIR* d = opendir(root_.Path("/var/log/packages").c_str());
    while (d && readdir(d)) ++n;
    if (d) closedir(d);
    return n - 2;
  }

  std::string dir_;
};

constexpr char kControl[] = "KIVO.Core.Package.Control";
constexpr char kPkg[] = "KIVO.Core.Package";

TEST_F(ControlTest, StartAndStopOnePackage) {
  Install("base");
  CgiAnswer start = Call(kControl, "start", {{"id", "[\"base\"]"}});
  ASSERT_TRUE(start.Success()) << start.body;
  EXPECT_EQ("base started", start.Data()["worker_message"][0].asString());
  EXPECT_TRUE(start.Data()["message"].isString());
  EXPECT_EQ(0, OperationLogs());
  CgiAnswer stop = Call(kControl, "stop", {{"id", "base"}});
  ASSERT_TRUE(stop.Success()) << stop.body;
  EXPECT_TRUE(stop.Data()["worker_message"].isArray());
  EXPECT_EQ("start-base\nstop-base\n", Order());
  EXPECT_EQ(0, OperationLogs());

  EXPECT_EQ(4500, Call(kControl, "stop", {{"id", "[]"}}).Code());
  CgiAnswer empty_id = Call(kControl, "stop", {{"id", "[\"\"]"}});
  EXPECT_EQ(4500, empty_id.Code());
  EXPECT_FALSE(empty_id.json["error"].isMember("errors"));
  EXPECT_EQ(4501, Call(kControl, "start", {{"id", "[\"not-installed\"]"}}).Code());
}

// While a start script runs, the package shows as starting.
TEST_F(ControlTest, StartingShowsWhileTheScriptRuns) {
  TestPackage slow;
  slow.id = "slow";
  slow.daemon = false;
  slow.scripts = {{"start-stop-status", "[ \"$1\" = start ] && sleep 2; exit 0\n"}};
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", slow.Build(dir_)}, &out)) << out;
  pid_t pid = fork();
  if (pid == 0) _exit(Kivoctl({"start", "slow"}));
  std::string status;
  for (int i = 0; i < 100 && status != "starting"; ++i) {
    usleep(20000);
    CgiAnswer a = Call(kPkg, "get", {{"id", "slow"}, {"additional", "[\"status\"]"}});
    status = a.Data()["additional"]["status"].asString();
  }
  EXPECT_EQ("starting", status);
  int exit_status;
  waitpid(pid, &exit_status, 0);
  EXPECT_EQ(0, WEXITSTATUS(exit_status));
  EXPECT_FALSE(NVX::TaskMgr("@administrators").hasTask("@KIVOPKG_STARTSTOP_slow"));
}

TEST_F(ControlTest, DependencyRefusalsCarryTheirDetails) {
  Install("base", "", true);
  Install("needs-base", "base>=1.0");
  ASSERT_EQ(0, Kivoctl({"stop", "base"}));
  CgiAnswer start = Call(kControl, "start", {{"id", "needs-base"}});
  EXPECT_EQ(4584, start.Code());
  EXPECT_EQ("base", start.Errors()["unstart_packages"].asString());
  EXPECT_TRUE(start.Errors()["uninstall_packages"].isArray());
  EXPECT_EQ(0, OperationLogs());

  ASSERT_TRUE(Call(kControl, "start", {{"id", "base"}}).Success());
  ASSERT_TRUE(Call(kControl, "start", {{"id", "needs-base"}}).Success());
  CgiAnswer stop = Call(kControl, "stop", {{"id", "base"}});
  EXPECT_EQ(4582, stop.Code());
  EXPECT_EQ("needs-base", stop.Errors()["packages"].asString());
}

TEST_F(ControlTest, BatchesFollowTheDependencyOrder) {
  Install("c-bottom", "", true);
  Install("b-middle", "c-bottom", true);
  Install("a-top", "b-middle");
  Install("z-alone");
  for (const char* id : {"b-middle", "c-bottom"}) ASSERT_EQ(0, Kivoctl({"stop", id}));
  Order();
  CgiAnswer start =
      Call(kControl, "start", {{"id", "[\"a-top\",\"c-bottom\",\"b-middle\",\"ghost\"]"}});
  ASSERT_TRUE(start.Success()) << start.body;
  EXPECT_EQ("start-c-bottom\nstart-b-middle\nstart-a-top\n", Order());
  EXPECT_TRUE(start.Data()["a-top"]["data"]["worker_message"].isArray());
  EXPECT_FALSE(start.Data().isMember("ghost"));  // not installed: quietly left out
  CgiAnswer stop = Call(kControl, "stop", {{"id", "[\"c-bottom\",\"b-middle\",\"a-top\"]"}});
  ASSERT_TRUE(stop.Success()) << stop.body;
  EXPECT_EQ("stop-a-top\nstop-b-middle\nstop-c-bottom\n", Order());
}

TEST_F(ControlTest, ABatchWithOneFailureReportsEachOutcome) {
  Install("good");
  Install("bad", "", false, true);
  CgiAnswer start = Call(kControl, "start", {{"id", "[\"good\",\"bad\"]"}});
  EXPECT_EQ(4580, start.Code()) << start.body;
  EXPECT_TRUE(start.Errors()["good"].isMember("data"));
  EXPECT_EQ(4580, start.Errors()["bad"]["code"].asInt());
  EXPECT_NE(std::string::npos,
            start.Errors()["bad"]["errors"]["message"].asString().find("start refused"));
  // What succeeded stays done.
  EXPECT_EQ("start-good\n", Order());
  EXPECT_EQ(0, OperationLogs());
}

TEST_F(ControlTest, BusyPackageToolIs4530) {
  Install("base");
  int lock = PMSLockFile(root_.Path("/run/kivo/pkgtool/lock"), 1);
  CgiAnswer start = Call(kControl, "start", {{"id", "base"}});
  EXPECT_EQ(4530, start.Code()) << start.body;
  EXPECT_EQ(4530, Call("KIVO.Core.Package.Uninstallation", "uninstall", {{"id", "base"}}).Code());
  PMSUnlockFile(lock);
}

TEST_F(ControlTest, FeasibilityHardSoftAndFailure) {
  Install("base", "", true);
  Install("needs-base", "base", true);
  Install("quiet");
  CgiAnswer ok =
      Call(kPkg, "feasibility_check", {{"type", "install_check"}, {"packages", "[\"new-one\"]"}});
  // Plenty of room on the test machine's volume: allowed, or a low-space advice.
  if (!ok.Success()) {
    EXPECT_EQ("soft", ok.Errors()["check_type"].asString()) << ok.body;
  }
  EXPECT_FALSE(ok.json.isMember("data"));

  CgiAnswer hard =
      Call(kPkg, "feasibility_check", {{"type", "stop_check"}, {"packages", "[\"base\"]"}});
  EXPECT_EQ(4556, hard.Code());
  EXPECT_EQ("hard", hard.Errors()["check_type"].asString());
  EXPECT_EQ("needs-base runs and needs base.", hard.Errors()["reasons"][0].asString());

  Kivoctl({"stop", "needs-base"});
  CgiAnswer soft =
      Call(kPkg, "feasibility_check", {{"type", "stop_check"}, {"packages", "[\"base\"]"}});
  EXPECT_EQ(4556, soft.Code());
  EXPECT_EQ("soft", soft.Errors()["check_type"].asString());
  EXPECT_EQ(1u, soft.Errors()["reasons"].size());

  int lock = PMSLockFile(root_.Path("/run/kivo/pkgtool/lock"), 1);
  CgiAnswer busy =
      Call(kPkg, "feasibility_check", {{"type", "install_check"}, {"packages", "[\"x\"]"}});
  EXPECT_EQ("hard", busy.Errors()["check_type"].asString());
  PMSUnlockFile(lock);

  CgiAnswer hostile =
      Call(kPkg, "feasibility_check", {{"type", "uninstall_check"}, {"packages", "[\"../etc\"]"}});
  EXPECT_EQ(120, hostile.Code());
  EXPECT_EQ("packages", hostile.Errors()["name"].asString());
  EXPECT_EQ(4500,
            Call(kPkg, "feasibility_check", {{"type", "stop_check"}, {"packages", "[]"}}).Code());
}

constexpr char kUninstall[] = "KIVO.Core.Package.Uninstallation";

// An id with a NUL byte in it, sent raw (%00) or spelt in JSON (\u0000),
// never acts on the package named before the NUL.
TEST_F(ControlTest, AnIdCarryingANulActsOnNoPackage) {
  Install("base", "", true);
  auto status = [this]() {
    return Call(kPkg, "get", {{"id", "base"}, {"additional", "[\"status\"]"}})
        .Data()["additional"]["status"]
        .asString();
  };
  ASSERT_EQ("running", status());
  const std::string raw("[\"base\0/../../zzz\"]", 18);
  const std::string spelt = "[\"base\\u0000/../../zzz\"]";
  for (const char* method : {"stop", "start"}) {
    EXPECT_EQ(101, Call("KIVO.Core.Package.Control", method, {{"id", raw}}).Code()) << method;
    CgiAnswer refused = Call("KIVO.Core.Package.Control", method, {{"id", spelt}});
    EXPECT_EQ(120, refused.Code()) << refused.body;
    EXPECT_EQ("condition", refused.Errors()["reason"].asString());
  }
  EXPECT_EQ(101, Call(kUninstall, "uninstall", {{"id", raw}}).Code());
  EXPECT_EQ(120, Call(kUninstall, "uninstall", {{"id", spelt}}).Code());
  EXPECT_EQ(120, Call(kPkg, "get", {{"id", spelt}}).Code());
  EXPECT_EQ(120,
            Call(kPkg, "feasibility_check", {{"type", "stop_check"}, {"packages", spelt}}).Code());
  EXPECT_EQ("running", status());
  EXPECT_TRUE(PackageRegistry::IsInstalled("base"));
  // The array form of one id works as the plain one.
  EXPECT_TRUE(Call("KIVO.Core.Package.Control", "stop", {{"id", "[\"base\"]"}}).Success());
  EXPECT_EQ("stop", status());
}

TEST_F(ControlTest, Uninstall) {
  Install("base", "", true);
  Install("needs-base", "base");
  CgiAnswer refused = Call(kUninstall, "uninstall", {{"id", "base"}});
  EXPECT_EQ(4562, refused.Code());
  EXPECT_EQ(4562, refused.Errors()["code"].asInt());
  EXPECT_EQ("needs-base", refused.Errors()["packages"].asString());
  EXPECT_TRUE(refused.Errors()["worker_message"].isArray());
  EXPECT_TRUE(PackageRegistry::IsInstalled("base"));

  CgiAnswer bad = Call(kUninstall, "uninstall", {{"id", "needs-base"}, {"extra_values", "{"}});
  EXPECT_EQ(4561, bad.Code());
  EXPECT_FALSE(bad.json["error"].isMember("errors"));
  EXPECT_TRUE(PackageRegistry::IsInstalled("needs-base"));

  // extra_values is a string that holds JSON, so it travels quoted.
  CgiAnswer done = Call(kUninstall, "uninstall",
                        {{"id", "needs-base"}, {"extra_values", "\"{\\\"keep\\\": false}\""}});
  ASSERT_TRUE(done.Success()) << done.body;
  EXPECT_TRUE(done.Data()["worker_message"].isArray());
  EXPECT_FALSE(PackageRegistry::IsInstalled("needs-base"));
  ASSERT_TRUE(Call(kUninstall, "uninstall", {{"id", "base"}}).Success());
  EXPECT_FALSE(PackageRegistry::IsInstalled("base"));
  EXPECT_EQ(4560, Call(kUninstall, "uninstall", {{"id", "gone"}}).Code());
  EXPECT_EQ(0, OperationLogs());
}

}  // namespace
