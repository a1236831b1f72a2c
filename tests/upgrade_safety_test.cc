// Upgrades that never lose data, through kivoctl on a temporary root: the
// safety copy of the package's data, the health gate, the automatic restore
// of the old version with its data, and the refusals that come before
// anything changes.

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "feasibility/feasibility_check.h"
#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/tree_copy.h"
#include "testing/upgrade_fixture.h"

namespace {

class UpgradeSafetyTest : public UpgradeFixture {
 protected:
  void ExpectRefused(int code, const TestPackage& p) {
    EXPECT_EQ(1, Install(p)) << out_;
    EXPECT_NE(std::string::npos, out_.find("[" + std::to_string(code) + "]")) << out_;
  }
  std::string InstalledVersion() {
    KeyValueMap info;
    return PackageRegistry::ReadInfo("test-app", &info) ? info["version"] : "";
  }
};

TEST_F(UpgradeSafetyTest, FailedMigrationGetsTheOldDataBackByteForByte) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  ASSERT_EQ(0, setxattr((data_ + "/config").c_str(), "user.owner", "ada", 3, 0));
  const std::string before = Fingerprint();
  ASSERT_NE(std::string::npos, before.find("db/journal/0001|f|644")) << before;

  v2_.scripts = {{"postupgrade", std::string(kRewriteTestData) + "exit 3\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, v2_);
  ExpectSaid("The upgrade to 2.0 failed in postupgrade; 1.0 and its data were restored.");
  EXPECT_EQ("1.0", InstalledVersion());
  EXPECT_EQ("1\n", FileText(root_.Path("/var/packages/test-app/target/version.txt")));
  EXPECT_EQ(before, Fingerprint());
  char owner[8] = {};
  EXPECT_EQ(3, getxattr((data_ + "/config").c_str(), "user.owner", owner, sizeof(owner)));
  ExpectNothingLeftBut(0);

  // A migration that fails before the new version is registered, likewise.
  TestPackage early = v2_;
  early.version = "2.1";  // a package file of its own
  early.scripts = {{"preupgrade", std::string(kRewriteTestData) + "exit 1\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, early);
  ExpectSaid("The upgrade to 2.1 failed in preupgrade; 1.0 and its data were restored.");
  EXPECT_EQ(before, Fingerprint());
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, ServiceThatNeverStartsIsReplacedByTheOldVersionWithItsData) {
  v1_.info = {{"logfile", "app.log"}};
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  const std::string data_before = FileText(data_ + "/db/main.db");

  v2_.daemon = false;
  v2_.info = {{"logfile", "app.log"}, {"health_grace_seconds", "1"}};
  v2_.scripts = {
      {"postupgrade", kRewriteTestData},
      {"start-stop-status",
       "case \"$1\" in start) echo 'cannot open port 8080' >> \"$KIVO_PKG_VAR/app.log\";;"
       " status) exit 1;; esac\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, v2_);
  ExpectSaid("The upgrade to 2.0 did not start within 1 s; 1.0 and its data were restored.");
  ExpectSaid("The last lines of test-app's log:\ncannot open port 8080");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_EQ(data_before, FileText(data_ + "/db/main.db"));
  EXPECT_FALSE(KLIBCFileExist((data_ + "/v2-only").c_str()));
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, FailingHealthCheckIsReplacedByTheOldVersion) {
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  v2_.scripts = {{"postupgrade", kRewriteTestData},
                 {"health", "echo 'database unreachable'; exit 2\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, v2_);
  ExpectSaid("The upgrade to 2.0 failed its health check; 1.0 and its data were restored.");
  ExpectSaid("database unreachable");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  EXPECT_FALSE(KLIBCFileExist((data_ + "/v2-only").c_str()));
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, HangingAndNoisyHealthCheckIsCutShort) {
  root_.Write("/etc/kivo/pkgtool.conf", "health_check_timeout_seconds=\"1\"\n");
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  v2_.scripts = {{"health",
                  "head -c 30000000 /dev/zero | tr '\\000' x\n"
                  "sleep 300 # kivo-health-hang-marker\n"}};
  time_t start = time(nullptr);
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, v2_);
  EXPECT_LT(time(nullptr) - start, 20);
  ExpectSaid(
      "The upgrade to 2.0 did not pass its health check within 1 s; 1.0 and its data were "
      "restored.");
  EXPECT_LT(out_.size(), 200000u);  // the check's 30 MB reached the answer only as a tail
  EXPECT_NE(0, RunProgram({"pgrep", "-f", "kivo-health-hang-marker"}, nullptr));
  EXPECT_EQ("test-app 1.0 running\n", Status());
}

TEST_F(UpgradeSafetyTest, HealthyUpgradeKeepsTheNewDataAndTheCopyAsTheOldVersion) {
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  v2_.scripts = {{"postupgrade", kRewriteTestData},
                 {"health",
                  "head -c 5000000 /dev/zero | tr '\\000' y || exit 9\n"
                  "[ -f \"$KIVO_PKG_VAR/v2-only\" ] && echo healthy\n"}};
  ASSERT_EQ(0, Install(v2_)) << out_;
  ExpectSaid("the health check passed");
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("migrated\n", FileText(data_ + "/db/main.db"));
  // The copy is 1.0's kept revision now (rollback_test.cc).
  ExpectNothingLeftBut(1);
}

TEST_F(UpgradeSafetyTest, NewVersionThatDoesNotStopKeepsTheCopyUntilTheNextOperation) {
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  const std::string before = FileText(data_ + "/db/main.db");
  const std::string up = data_ + "/v2-up";
  v2_.daemon = false;
  v2_.scripts = {{"postupgrade", kRewriteTestData},
                 {"health", "exit 1\n"},
                 {"start-stop-status",
                  "case \"$1\" in start) touch \"$KIVO_PKG_VAR/v2-up\";; stop) exit 1;;"
                  " status) [ -f \"$KIVO_PKG_VAR/v2-up\" ];; esac\n"}};
  ExpectRefused(PKG_ERR_SCRIPT_FAILED, v2_);
  ExpectSaid(
      "The upgrade to 2.0 failed its health check, and 2.0 did not stop: it stays "
      "installed and running with the data it changed; 1.0 and the copy of its data are "
      "kept, and the next package operation puts them back once 2.0 stops.");
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("migrated\n", FileText(data_ + "/db/main.db"));

  // While it runs, the next operation leaves it be; once it is gone, the
  // next operation puts 1.0 back with its data.
  EXPECT_EQ(0, Kivoctl({"install", PackageWithInfo("other-app").Build(dir_)}, &out_)) << out_;
  EXPECT_EQ("test-app 2.0 running\n", Status());
  ASSERT_EQ(0, unlink(up.c_str()));
  EXPECT_EQ(0, Kivoctl({"stop", "test-app"}, &out_)) << out_;
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  EXPECT_EQ(before, FileText(data_ + "/db/main.db"));
  // 2.0's record and payload, no one's now, go with the next clean-up.
  EXPECT_EQ(0, Kivoctl({"uninstall", "other-app"}, &out_)) << out_;
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, StoppedPackageIsJudgedByItsScriptsAndStaysStopped) {
  ASSERT_EQ(0, Install(v1_)) << out_;
  const std::string before = Fingerprint();
  TestPackage failing = v2_;
  failing.version = "1.5";
  failing.scripts = {{"postupgrade", std::string(kRewriteTestData) + "exit 1\n"}};
  ExpectRefused(PKG_ERR_UPGRADE_ROLLED_BACK, failing);
  ExpectSaid("The upgrade to 1.5 failed in postupgrade; 1.0 and its data were restored.");
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  EXPECT_EQ(before, Fingerprint());

  // Neither started nor checked: its failing start and health check do not
  // count.
  v2_.daemon = false;
  v2_.scripts = {{"health", "exit 1\n"},
                 {"start-stop-status",
                  "case \"$1\" in start) echo start-script-ran; exit 1;; "
                  "status) exit 1;; esac\n"}};
  ASSERT_EQ(0, Install(v2_)) << out_;
  EXPECT_EQ("test-app 2.0 stopped\n", Status());
  EXPECT_EQ(std::string::npos, out_.find("start-script-ran")) << out_;
  ExpectNothingLeftBut(1);
}

TEST_F(UpgradeSafetyTest, DataWithAFifoIsRefusedBeforeAnythingChanges) {
  v1_.scripts = {{"postinst", "mkfifo \"$KIVO_PKG_VAR/queue\"\n"}};
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  ExpectRefused(PKG_ERR_DATA_NOT_COPYABLE, v2_);
  ExpectSaid(
      "The data of test-app cannot be copied safely before the upgrade: queue is a fifo. "
      "Nothing was changed.");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, DataWithASymlinkLeadingOutIsRefusedAndNothingOutsideIsRead) {
  const std::string outside = root_.Path("/outside");
  root_.Write("/outside/secret.txt", "not the package's\n");
  v1_.scripts = {{"postinst",
                  "ln -s \"$KIVO_ROOT/outside/secret.txt\" \"$KIVO_PKG_VAR/escape\"\n"
                  "ln -s ../../../outside \"$KIVO_PKG_VAR/climb\"\n"}};
  ASSERT_EQ(0, Install(v1_)) << out_;
  // Any open, read or write of what the links lead to shows here.
  int watch = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  ASSERT_GE(watch, 0);
  ASSERT_GE(inotify_add_watch(watch, outside.c_str(), IN_ALL_EVENTS), 0);

  ExpectRefused(PKG_ERR_DATA_NOT_COPYABLE, v2_);
  ExpectSaid("outside the data folder. Nothing was changed.");
  EXPECT_EQ("test-app 1.0 stopped\n", Status());
  char events[4096];
  EXPECT_LT(read(watch, events, sizeof(events)), 0) << "something outside was touched";
  close(watch);
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, NoRoomForTheCopyIsRefusedInWordsUnlessThePackageNeedsNone) {
  const std::string appdata = root_.Path("/volume1/@appdata");
  ASSERT_EQ(0, KIVOFSMkdirP(appdata.c_str()));
  if (PMSCanReflink(appdata)) GTEST_SKIP() << "this file system shares blocks: copies take no room";
  v1_.scripts = {{"postinst", "head -c 3000000 /dev/zero > \"$KIVO_PKG_VAR/big\"\n"}};
  ASSERT_EQ(0, Install(v1_, {"--run"})) << out_;
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 2097152}]");
  ExpectRefused(PKG_ERR_NO_ROOM_FOR_DATA_COPY, v2_);
  ExpectSaid("The upgrade of test-app needs 3 MiB for a safety copy of its data besides");
  ExpectSaid("/volume1 has 2 MiB free. Nothing was changed.");
  EXPECT_EQ("test-app 1.0 running\n", Status());
  // Before the upgrade, the feasibility check advises what an upgrade
  // without the copy gives up; with room for the copy it says nothing.
  PKLIBSZLIST reasons = KLIBCSzListAlloc(8);
  ASSERT_EQ(2, KIVOFeasibilityCheck(KIVO_FEASIBILITY_INSTALL, KIVO_FEASIBILITY_SOFT, &reasons,
                                    "test-app", 0));
  EXPECT_EQ(std::string("Volume /volume1 has no room for a safety copy of the data of test-app (3 "
                        "MiB needed, 2 MiB free). The upgrade can go on without one, but if it "
                        "then fails, the data it changed cannot be brought back."),
            KLIBCSzListGet(reasons, 1));
  KLIBCSzListFree(reasons);
  root_.Write("/etc/kivo/volumes.json", "[{\"path\": \"/volume1\", \"status\": \"normal\"}]");
  reasons = KLIBCSzListAlloc(8);
  EXPECT_EQ(0, KIVOFeasibilityCheck(KIVO_FEASIBILITY_INSTALL, KIVO_FEASIBILITY_SOFT, &reasons,
                                    "test-app", 0));
  KLIBCSzListFree(reasons);
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 2097152}]");

  // The administrator who accepts that upgrades without the copy.
  ASSERT_EQ(0, Install(v2_, {"--without-data-copy"})) << out_;
  EXPECT_EQ("test-app 2.0 running\n", Status());
  EXPECT_EQ("", Entries("/volume1/@appdata/.snapshots"));

  TestPackage uncopied = v2_;
  uncopied.version = "2.1";
  uncopied.info = {{"upgrade_data_copy", "no"}};
  ASSERT_EQ(0, Install(uncopied)) << out_;
  EXPECT_EQ("test-app 2.1 running\n", Status());
  ExpectNothingLeftBut(0);
}

TEST_F(UpgradeSafetyTest, HealthLimitsInInfoMustBeInBounds) {
  std::string src = dir_ + "/wild";
  root_.Write("/tmp/packages/wild/INFO",
              "package=\"test-app\"\nversion=\"2.0\"\nhealth_grace_seconds=\"100000\"\n");
  ASSERT_EQ(0, KIVOFSMkdirP((src + "/package").c_str()));
  EXPECT_NE(0, Kivoctl({"build", src, dir_ + "/wild.kpk"}, &out_));
  ExpectSaid("health_grace_seconds: must be a whole number of seconds from 1 to 600");
}

}  // namespace
