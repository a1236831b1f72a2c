// kill -9 of the package tool at each step of each operation: afterwards the
// package's code is fully there in its old state or fully in its new one (or
// fully gone), and the next operation clears what the killed one left
// behind; after it, code and data are one version's, never a mix.

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class CrashTest : public ::testing::TestWithParam<const char*> {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    dir_ = root_.Path("/tmp/packages");
    ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
    v1_.files = {{"version.txt", "1\n"}};
    v1_.scripts = {{"postinst", "echo 1 > \"$KIVO_PKG_VAR/data.txt\"\n"}};
    v2_ = v1_;
    v2_.version = "2.0";
    v2_.files = {{"version.txt", "2\n"}};
    // The migration changes the data before the new version is published.
    v2_.scripts = {{"preupgrade", "echo 2 > \"$KIVO_PKG_VAR/data.txt\"\n"}};
    other_.id = "other-app";
  }
  void TearDown() override { StopInstalledPackages(); }

  // Runs kivoctl with the fault point set; it must die by SIGKILL.
  void CrashAt(const char* step, std::vector<std::string> args) {
    std::string out;
    int status = Kivoctl(args, &out, {{"KIVO_PKGTOOL_FAULT", step}});
    ASSERT_EQ(128 + 9, status) << "did not stop at " << step << ": " << out;
  }

  // The package is either absent, or installed at `version` with its files.
  void ExpectWhole(const std::string& version) {
    KeyValueMap info;
    if (version.empty()) {
      EXPECT_FALSE(PackageRegistry::IsInstalled("test-app"));
      return;
    }
    ASSERT_TRUE(PackageRegistry::ReadInfo("test-app", &info));
    EXPECT_EQ(version, info["version"]);
    std::string text;
    ASSERT_TRUE(KIVOReadFile(root_.Path("/var/packages/test-app/target/version.txt"), &text));
    EXPECT_EQ(version.substr(0, 1) + "\n", text);
  }

  // The data a version keeps: "1" or "2"; "" when the data folder is gone.
  std::string Data() { return FileText(root_.Path("/volume1/@appdata/test-app/data.txt")); }
  // The package is installed at `version`, code and data.
  void ExpectWholeWithData(const std::string& version) {
    ExpectWhole(version);
    EXPECT_EQ(version.substr(0, 1) + "\n", Data());
  }

  // Another operation recovers: nothing is left that no package owns; only
  // kept earlier versions (each with its record and payload) stay besides
  // the installed packages.
  void ExpectRecoveredByNextOperation() {
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install", other_.Build(dir_)}, &out)) << out;
    const DataCopies copies = ListDataCopies(root_.Path("/volume1/@appdata/.snapshots"));
    EXPECT_EQ(copies.kept, copies.entries.size()) << "copies left: " << copies.entries.size();
    for (const char* dir : {"/var/packages/.records", "/volume1/@appstore"}) {
      RunProgram({"ls", "-A", root_.Path(dir)}, &out);
      EXPECT_EQ(PackageRegistry::List().size() + copies.kept,
                static_cast<size_t>(std::count(out.begin(), out.end(), '\n')))
          << dir << ":\n"
          << out;
    }
  }

  TempRoot root_;
  std::string dir_;
  TestPackage v1_, v2_, other_;
};

const char* const kInstallSteps[] = {"staged", "extracted", "before_publish", "published", "done"};
// Steps at or after which the new version is the installed one.
bool Committed(const std::string& step) { return step == "published" || step == "done"; }

class InstallCrashTest : public CrashTest {};

TEST_P(InstallCrashTest, FreshInstall) {
  CrashAt(GetParam(), {"install", v1_.Build(dir_)});
  ExpectWhole(Committed(GetParam()) ? "1.0" : "");
  ExpectRecoveredByNextOperation();
}

TEST_P(InstallCrashTest, Upgrade) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_)}, &out)) << out;
  CrashAt(GetParam(), {"install", v2_.Build(dir_)});
  ExpectWhole(Committed(GetParam()) ? "2.0" : "1.0");
  // An upgrade is confirmed only at its end: before that, the next
  // operation puts the old version back with the data it had.
  ExpectRecoveredByNextOperation();
  ExpectWholeWithData(std::string(GetParam()) == "done" ? "2.0" : "1.0");
  // And the package can be upgraded again afterwards.
  ASSERT_EQ(0, Kivoctl({"install", v2_.Build(dir_)}, &out)) << out;
  ExpectWholeWithData("2.0");
}

TEST_F(CrashTest, StartAfterACrashStartsTheOldVersionOnItsOwnData) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_), "--run"}, &out)) << out;
  CrashAt("published", {"install", v2_.Build(dir_)});
  ExpectWhole("2.0");
  ASSERT_EQ(0, Kivoctl({"start", "test-app"}, &out)) << out;
  Kivoctl({"status", "test-app"}, &out);
  EXPECT_EQ("test-app 1.0 running\n", out);
  ExpectWholeWithData("1.0");
}

// Killed right after its commit (UPGRADED_FROM on disk), before its copy
// is renamed: the new version stays with its data, and the clean-up makes
// the copy the kept revision that a rollback returns to; with no revisions
// kept, it drops the copy.
TEST_F(CrashTest, UpgradeKilledAfterItsCommitStaysAndKeepsTheOldVersion) {
  std::string out;
  for (const char* keep : {"1", "0"}) {
    SCOPED_TRACE(std::string("keep_revisions=") + keep);
    root_.Write("/etc/kivo/pkgtool.conf", std::string("keep_revisions=\"") + keep + "\"\n");
    ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_), "--run"}, &out)) << out;
    CrashAt("confirmed", {"install", v2_.Build(dir_)});
    ExpectWholeWithData("2.0");
    ExpectRecoveredByNextOperation();
    ExpectWholeWithData("2.0");
    const DataCopies copies = ListDataCopies(root_.Path("/volume1/@appdata/.snapshots"));
    EXPECT_EQ(std::string(keep) == "1" ? 1u : 0u, copies.kept);
    if (std::string(keep) == "1") {
      ASSERT_EQ(0, Kivoctl({"rollback", "test-app"}, &out)) << out;
      ExpectWholeWithData("1.0");
    } else {
      EXPECT_NE(0, Kivoctl({"rollback", "test-app"}, &out)) << out;
    }
    ASSERT_EQ(0, Kivoctl({"uninstall", "test-app"}, &out)) << out;
  }
}

// The steps of an upgrade's safety copy and of a restore.
const char* const kRestoreSteps[] = {"snapshot_taken", "restore_begun", "restore_half_done",
                                     "old_published"};

class RestoreCrashTest : public CrashTest {};

TEST_P(RestoreCrashTest, FailedUpgrade) {
  const std::string step = GetParam();
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_), "--run"}, &out)) << out;
  TestPackage broken = v2_;
  broken.version = "2.1";  // a package file of its own
  broken.scripts = {{"postupgrade", "echo 2 > \"$KIVO_PKG_VAR/data.txt\"; exit 1\n"}};
  CrashAt(step.c_str(), {"install", broken.Build(dir_)});
  if (step == "snapshot_taken" || step == "old_published") {
    ExpectWholeWithData("1.0");
  } else if (step == "restore_begun") {
    ExpectWholeWithData("2.1");
  } else {
    // Between the restore's two renames the data folder is away; the next
    // operation puts the copy in its place.
    ExpectWhole("2.1");
    EXPECT_EQ("", Data());
  }
  ExpectRecoveredByNextOperation();
  ExpectWholeWithData("1.0");
  Kivoctl({"status", "test-app"}, &out);
  EXPECT_EQ("test-app 1.0 stopped\n", out);
  ASSERT_EQ(0, Kivoctl({"install", v2_.Build(dir_)}, &out)) << out;
  ExpectWholeWithData("2.0");
}

INSTANTIATE_TEST_SUITE_P(Steps, RestoreCrashTest, ::testing::ValuesIn(kRestoreSteps));

INSTANTIATE_TEST_SUITE_P(Steps, InstallCrashTest, ::testing::ValuesIn(kInstallSteps));

// The steps of a rollback to the version an upgrade kept.
const char* const kRollbackSteps[] = {"rollback_begun", "rollback_data_kept", "rollback_published",
                                      "rollback_done"};

class RollbackCrashTest : public CrashTest {};

TEST_P(RollbackCrashTest, Rollback) {
  const std::string step = GetParam();
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_), "--run"}, &out)) << out;
  ASSERT_EQ(0, Kivoctl({"install", v2_.Build(dir_)}, &out)) << out;
  ExpectWholeWithData("2.0");
  CrashAt(step.c_str(), {"rollback", "test-app"});
  if (step == "rollback_begun") {
    ExpectWholeWithData("2.0");
  } else if (step == "rollback_done") {
    ExpectWholeWithData("1.0");
  } else {
    // Between the moves of the data folder it is away; the next operation
    // puts the kept copy in its place.
    ExpectWhole(step == "rollback_published" ? "1.0" : "2.0");
    EXPECT_EQ("", Data());
  }
  ExpectRecoveredByNextOperation();
  ExpectWholeWithData("1.0");
  Kivoctl({"status", "test-app"}, &out);
  EXPECT_EQ(step == "rollback_done" ? "test-app 1.0 running\n" : "test-app 1.0 stopped\n", out);
  // What 2.0 wrote was kept: a second rollback undoes the first.
  ASSERT_EQ(0, Kivoctl({"rollback", "test-app"}, &out)) << out;
  ExpectWholeWithData("2.0");
}

INSTANTIATE_TEST_SUITE_P(Steps, RollbackCrashTest, ::testing::ValuesIn(kRollbackSteps));

class UninstallCrashTest : public CrashTest {};

TEST_P(UninstallCrashTest, Uninstall) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", v1_.Build(dir_), "--run"}, &out)) << out;
  CrashAt(GetParam(), {"uninstall", "test-app"});
  ExpectWhole(std::string(GetParam()) == "uninstall_before_unpublish" ? "1.0" : "");
  ExpectRecoveredByNextOperation();
}

INSTANTIATE_TEST_SUITE_P(Steps, UninstallCrashTest,
                         ::testing::Values("uninstall_before_unpublish", "unpublished",
                                           "uninstall_done"));

}  // namespace
