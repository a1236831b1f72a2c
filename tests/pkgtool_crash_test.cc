// kill -9 of the package tool at each step of each operation: afterwards the
// package is fully there in its old state or fully in its new one (or fully
// gone), and the next operation clears what the killed one left behind.

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
    v2_ = v1_;
    v2_.version = "2.0";
    v2_.files = {{"version.txt", "2\n"}};
    other_.id = "other-app";
  }
  void TearDown() override { Kivoctl({"stop", "test-app"}); }

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

  // Another operation recovers: nothing is left that no package owns.
  void ExpectRecoveredByNextOperation() {
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install", other_.Build(dir_)}, &out)) << out;
    for (const char* dir : {"/var/packages/.records", "/volume1/@appstore"}) {
      RunProgram({"ls", "-A", root_.Path(dir)}, &out);
      EXPECT_EQ(PackageRegistry::List().size(),
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
  ExpectRecoveredByNextOperation();
  // And the package can be upgraded again afterwards.
  ASSERT_EQ(0, Kivoctl({"install", v2_.Build(dir_)}, &out)) << out;
  ExpectWhole("2.0");
}

INSTANTIATE_TEST_SUITE_P(Steps, InstallCrashTest, ::testing::ValuesIn(kInstallSteps));

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
