// The package tool through kivoctl and PackageManager on a temporary root:
// install, upgrade, start, stop, uninstall, and the refusals that come from
// the system's real state.

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

class PackageToolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // Unsigned test packages are accepted; signatures have tests of their own.
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  }
  void TearDown() override { StopInstalledPackages(); }

  std::string Build(const TestPackage& p) { return p.Build(dir_); }
  int Install(const std::string& file, std::vector<std::string> extra = {}) {
    std::vector<std::string> args = {"install", file};
    args.insert(args.end(), extra.begin(), extra.end());
    return Kivoctl(args, &out_);
  }
  // Installs `file` and expects the tool to refuse it with result `code`.
  void ExpectRefused(int code, const std::string& file, std::vector<std::string> extra = {}) {
    EXPECT_EQ(1, Install(file, extra)) << out_;
    EXPECT_NE(std::string::npos, out_.find("[" + std::to_string(code) + "]")) << out_;
  }
  std::string Status(const std::string& id) {
    std::string out;
    Kivoctl({"status", id}, &out);
    return out;
  }
  std::string InstalledVersion(const std::string& id) {
    KeyValueMap info;
    return PackageRegistry::ReadInfo(id, &info) ? info["version"] : "";
  }
  // Every record and payload folder left belongs to an installed package or
  // to an earlier version an upgrade kept (revisions.h).
  void ExpectNoLeftovers() {
    const size_t kept = ListDataCopies(root_.Path("/volume1/@appdata/.snapshots")).kept;
    size_t records = 0, payloads = 0;
    for (const char* dir : {"/var/packages/.records", "/volume1/@appstore"}) {
      std::string out;
      RunProgram({"ls", "-A", root_.Path(dir)}, &out);
      (dir[1] == 'v' && dir[5] == 'p' ? records : payloads) +=
          out.empty() ? 0 : std::count(out.begin(), out.end(), '\n');
    }
    EXPECT_EQ(PackageRegistry::List().size() + kept, records);
    EXPECT_EQ(PackageRegistry::List().size() + kept, payloads);
  }

  TempRoot root_;
  std::string dir_;
  std::string out_;
};

TEST_F(PackageToolTest, InstallStartStopUninstall) {
  TestPackage app;
  app.files = {{"bin/tool", "#!/bin/sh\necho tool\n"}, {"share/readme.txt", "hello\n"}};
  app.info = {{"logfile", "app.log"}, {"displayname", "Test App"}};
  app.scripts = {{"postinst",
                  "echo installed-$KIVO_PKG_VERSION > \"$KIVO_PKG_VAR/app.log\"\n"
                  "echo 'Welcome to Test App' >> \"$KIVO_WORKER_MSG\"\n"}};
  ASSERT_EQ(0, Install(Build(app), {"--run"})) << out_;
  EXPECT_NE(std::string::npos, out_.find("Welcome to Test App"));
  EXPECT_EQ("test-app 1.0 running\n", Status("test-app"));
  std::string readme;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/target/share/readme.txt"), &readme));
  EXPECT_EQ("hello\n", readme);

  std::string log;
  EXPECT_EQ(0, Kivoctl({"log", "test-app"}, &log));
  EXPECT_EQ("installed-1.0\n", log);

  EXPECT_EQ(0, Kivoctl({"stop", "test-app"}, &out_)) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status("test-app"));
  EXPECT_EQ(0, Kivoctl({"start", "test-app"}, &out_)) << out_;
  EXPECT_EQ("test-app 1.0 running\n", Status("test-app"));

  EXPECT_EQ(0, Kivoctl({"uninstall", "test-app"}, &out_)) << out_;
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/volume1/@appdata/test-app").c_str()));
  EXPECT_EQ(1, Kivoctl({"status", "test-app"}));
  ExpectNoLeftovers();
}

TEST_F(PackageToolTest, UpgradeKeepsDataAndFailedUpgradeKeepsTheOldVersionRunning) {
  TestPackage v1;
  v1.files = {{"version.txt", "one\n"}};
  v1.scripts = {{"postinst", "echo precious > \"$KIVO_PKG_VAR/data.txt\"\n"}};
  ASSERT_EQ(0, Install(Build(v1), {"--run"})) << out_;

  TestPackage broken = v1;
  broken.version = "2.0";
  broken.files = {{"version.txt", "two\n"}};
  broken.scripts = {{"postupgrade", "echo 'cannot migrate' >&2; exit 3\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, Build(broken));
  EXPECT_EQ("1.0", InstalledVersion("test-app"));
  EXPECT_EQ("test-app 1.0 running\n", Status("test-app"));
  std::string text;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/target/version.txt"), &text));
  EXPECT_EQ("one\n", text);
  ExpectNoLeftovers();

  TestPackage v2 = v1;
  v2.version = "2.0";
  v2.files = {{"version.txt", "two\n"}};
  v2.scripts = {
      {"postupgrade", "echo \"from $KIVO_PKG_OLD_VERSION\" >> \"$KIVO_PKG_VAR/data.txt\"\n"}};
  ASSERT_EQ(0, Install(Build(v2))) << out_;
  EXPECT_EQ("2.0", InstalledVersion("test-app"));
  EXPECT_EQ("test-app 2.0 running\n", Status("test-app"));  // it ran, so it runs again
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/var/data.txt"), &text));
  EXPECT_EQ("precious\nfrom 1.0\n", text);
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/target/version.txt"), &text));
  EXPECT_EQ("two\n", text);
  ExpectNoLeftovers();

  ExpectRefused(PKG_ERR_NOT_NEWER, Build(v1), {"--no-force"});  // a downgrade needs force
}

TEST_F(PackageToolTest, FailedInstallScriptsLeaveNothing) {
  TestPackage pre;
  pre.scripts = {{"preinst", "exit 1\n"}};
  ExpectRefused(PKG_ERR_SCRIPT_FAILED, Build(pre));
  TestPackage post;
  post.id = "post-fails";
  post.scripts = {{"postinst", "exit 1\n"}};
  EXPECT_EQ(1, Install(Build(post)));
  EXPECT_TRUE(PackageRegistry::List().empty());
  EXPECT_FALSE(KLIBCFileExist(root_.Path("/volume1/@appdata/test-app").c_str()));
  ExpectNoLeftovers();
}

TEST_F(PackageToolTest, HangingScriptIsKilledAtTheTimeLimit) {
  root_.Write("/etc/kivo/pkgtool.conf", "script_timeout=\"1\"\n");
  TestPackage slow;
  slow.scripts = {{"preinst", "sleep 300 # kivo-hang-marker\n"}};
  time_t start = time(nullptr);
  EXPECT_EQ(1, Install(Build(slow)));
  EXPECT_LT(time(nullptr) - start, 20);
  EXPECT_NE(std::string::npos, out_.find("was killed")) << out_;
  EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));
  EXPECT_NE(0, RunProgram({"pgrep", "-f", "kivo-hang-marker"}, nullptr));
}

TEST_F(PackageToolTest, DependenciesConflictsAndServices) {
  TestPackage base;
  base.id = "base-app";
  base.version = "1.5";
  TestPackage needs_base;
  needs_base.id = "needs-base";
  needs_base.info = {{"install_dep_packages", "base-app>=1.0"}};
  std::string needs_file = Build(needs_base);

  ExpectRefused(PKG_ERR_DEPENDENCY, needs_file);  // not installed
  ASSERT_EQ(0, Install(Build(base)));
  EXPECT_EQ(1, Install(needs_file));  // installed but stopped
  ASSERT_EQ(0, Kivoctl({"start", "base-app"}));
  ASSERT_EQ(0, Install(needs_file, {"--run"})) << out_;

  // Stopping or removing what others need is refused.
  EXPECT_EQ(1, Kivoctl({"stop", "base-app"}, &out_));
  EXPECT_NE(std::string::npos, out_.find("[269]")) << out_;
  EXPECT_EQ(1, Kivoctl({"uninstall", "base-app"}, &out_));
  EXPECT_NE(std::string::npos, out_.find("needs-base")) << out_;

  PackageManager pm;
  std::vector<std::string> order;
  ASSERT_TRUE(pm.getDependencyOrder(order));
  // Dependents come before what they need.
  auto before = [&order](const std::string& a, const std::string& b) {
    return std::find(order.begin(), order.end(), a) < std::find(order.begin(), order.end(), b);
  };
  EXPECT_TRUE(before("needs-base", "base-app"));

  // A package without a service only needs to be installed.
  TestPackage library;
  library.id = "a-library";
  library.daemon = false;
  library.info = {{"startable", "no"}};
  ASSERT_EQ(0, Install(Build(library)));
  TestPackage uses_library;
  uses_library.id = "uses-library";
  uses_library.info = {{"install_dep_packages", "a-library"}};
  EXPECT_EQ(0, Install(Build(uses_library))) << out_;

  ExpectRefused(PKG_ERR_CONFLICT,
                Build(PackageWithInfo("rival", {{"install_conflict_packages", "needs-base"}})));
  // A conflict declared by the installed side counts too.
  ASSERT_EQ(
      0, Install(Build(PackageWithInfo("declares", {{"install_conflict_packages", "victim<2"}}))));
  ExpectRefused(PKG_ERR_CONFLICT, Build(PackageWithInfo("victim")));

  root_.Write("/etc/kivo/services.conf", "pgsql=\"stopped\"\n");
  TestPackage db = PackageWithInfo("db-app", {{"install_dep_services", "pgsql"}});
  ExpectRefused(PKG_ERR_SERVICE_NOT_RUNNING, Build(db));
  root_.Write("/etc/kivo/services.conf", "pgsql=\"running\"\n");
  EXPECT_EQ(0, Install(Build(db)));
}

TEST_F(PackageToolTest, DeviceVolumesAndPorts) {
  root_.Write("/etc/kivo/device.conf", "os_version=\"7.2-0064\"\narch=\"x86_64\"\n");
  ExpectRefused(PKG_ERR_OS_TOO_OLD,
                Build(PackageWithInfo("test-app", {{"os_min_ver", "8.0-0001"}})));
  ExpectRefused(PKG_ERR_OS_TOO_NEW,
                Build(PackageWithInfo("old-app", {{"os_max_ver", "6.2-9999"}})));
  ExpectRefused(PKG_ERR_NOT_SUPPORTED,
                Build(PackageWithInfo("arm-app", {{"arch", "armv8 aarch64"}})));

  TestPackage app;
  app.files = {{"data.bin", std::string(4096, 'x')}};  // unpacks to 4 KiB, more than the cap
  std::string file = Build(app);
  root_.Write("/etc/kivo/volumes.json", "[{\"path\": \"/volume1\", \"status\": \"crashed\"}]");
  ExpectRefused(PKG_ERR_VOLUME_CRASHED, file);
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 1000}]");
  ExpectRefused(PKG_ERR_NO_SPACE, file);
  root_.Write("/etc/kivo/volumes.json", "[]");
  ExpectRefused(PKG_ERR_NO_VOLUME, file);
  root_.Write("/etc/kivo/volumes.json", "[{\"path\": \"/volume1\", \"status\": \"normal\"}]");

  // A port someone listens on.
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  socklen_t len = sizeof(addr);
  ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
  listen(fd, 1);
  getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
  TestPackage web;
  web.id = "web-app";
  web.info = {{"adminport", std::to_string(ntohs(addr.sin_port))}};
  ExpectRefused(PKG_ERR_PORT_IN_USE, Build(web));
  close(fd);
  EXPECT_EQ(0, Install(Build(web))) << out_;
}

TEST_F(PackageToolTest, BusyToolAnswers275InsteadOfWaiting) {
  int lock = PMSLockFile(root_.Path("/run/kivo/pkgtool/lock"), 1);
  ASSERT_GE(lock, 0);
  TestPackage app;
  time_t start = time(nullptr);
  ExpectRefused(PKG_ERR_BUSY, Build(app));
  EXPECT_LT(time(nullptr) - start, 10);
  PMSUnlockFile(lock);
  EXPECT_EQ(0, Install(Build(app))) << out_;
}

TEST_F(PackageToolTest, ConcurrentInstallsNeverCorruptTheRegistry) {
  std::vector<std::string> files;
  for (int i = 0; i < 4; ++i) {
    TestPackage p;
    p.id = "parallel-" + std::to_string(i);
    files.push_back(Build(p));
  }
  std::vector<pid_t> children;
  for (const std::string& f : files) {
    pid_t pid = fork();
    if (pid == 0) _exit(Kivoctl({"install", f}));
    children.push_back(pid);
  }
  int installed = 0;
  for (pid_t pid : children) {
    int status;
    waitpid(pid, &status, 0);
    installed += WEXITSTATUS(status) == 0;
  }
  EXPECT_EQ(static_cast<size_t>(installed), PackageRegistry::List().size());
  EXPECT_GE(installed, 1);
  ExpectNoLeftovers();
}

TEST_F(PackageToolTest, WizardAnswersReachTheScripts) {
  TestPackage app;
  app.members = {{"WIZARD_UIFILES/install_uifile", "[{\"step_title\": \"Name\"}]"},
                 {"WIZARD_UIFILES/uninstall_uifile", "[{\"step_title\": \"Keep\"}]"}};
  app.scripts = {{"postinst", "echo \"$KIVO_WIZARD_name\" > \"$KIVO_PKG_VAR/name\"\n"},
                 {"preuninst", "echo \"answers: $(cat \"$KIVO_WIZARD_VALUES\")\"\n"}};
  ASSERT_EQ(0, Install(Build(app), {"--wizard", "{\"name\": \"Ada\", \"n\": 3}"})) << out_;
  std::string text;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/var/name"), &text));
  EXPECT_EQ("Ada\n", text);

  PackageManager pm;
  PackageInfo info, ui;
  ASSERT_TRUE(pm.getPackageInfo("test-app", info));
  EXPECT_TRUE(info.hasWizard(PKG_OP_UNINSTALL));
  ASSERT_TRUE(pm.readUIFile(PKG_OP_UNINSTALL, info, ui, "enu"));
  EXPECT_EQ("Keep", ui.getUIFile()[0]["step_title"].asString());

  ExpectRefused(PKG_ERR_BAD_WIZARD_VALUES, Build(app), {"--wizard", "{broken"});
  ASSERT_EQ(0, Kivoctl({"uninstall", "test-app", "--wizard", "{\"keep\": true}"}, &out_)) << out_;
  // preuninst read them (its output is in the operation log).
  const size_t answers = out_.find("answers: {");
  ASSERT_NE(std::string::npos, answers) << out_;
  EXPECT_NE(std::string::npos, out_.find("\"keep\"", answers)) << out_;
}

TEST_F(PackageToolTest, StatusWithoutAPidFileAsksTheScript) {
  TestPackage app;
  app.daemon = false;
  app.scripts = {{"start-stop-status",
                  "case \"$1\" in status) [ -f \"$KIVO_PKG_VAR/on\" ];; "
                  "start) touch \"$KIVO_PKG_VAR/on\";; stop) rm -f \"$KIVO_PKG_VAR/on\";; esac\n"}};
  ASSERT_EQ(0, Install(Build(app))) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status("test-app"));
  ASSERT_EQ(0, Kivoctl({"start", "test-app"}));
  EXPECT_EQ("test-app 1.0 running\n", Status("test-app"));
  EXPECT_EQ(3u, PackageManager().getPkgRoughStatus("test-app"));
}

}  // namespace
