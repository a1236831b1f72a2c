// The package tool's volume, temporary-space and progress functions on the
// volume configuration of a temporary root.

#include "pkgtool/pms.h"

#include <gtest/gtest.h>

#include "klibc/last_error.h"
#include "pkgtool/package_manager.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class PMSTest : public ::testing::Test {
 protected:
  void Volumes(const std::string& json) { root_.Write("/etc/kivo/volumes.json", json); }
  TempRoot root_;
};

TEST_F(PMSTest, DefaultVolumeIsStoredAndItsTroublesReported) {
  std::string path = "unchanged";
  EXPECT_TRUE(PMSGetPackageDefVol(path));
  EXPECT_EQ("", path);  // none set
  ASSERT_TRUE(PMSSavePackageDefVolPath("/volume1"));
  EXPECT_TRUE(PMSGetPackageDefVol(path));
  EXPECT_EQ("/volume1", path);

  EXPECT_FALSE(PMSSavePackageDefVolPath("/volume9"));
  EXPECT_EQ(KLIBC_ERR_VOLUME_NOT_FOUND, KLIBCErrGet());
  EXPECT_FALSE(PMSSavePackageDefVolPath("/volume1/../etc"));

  Volumes("[{\"path\": \"/volume1\", \"status\": \"crashed\"}]");
  EXPECT_FALSE(PMSGetPackageDefVol(path));
  EXPECT_EQ(KLIBC_ERR_VOLUME_CRASHED, KLIBCErrGet());
  Volumes("[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 1}]");
  EXPECT_FALSE(PMSGetPackageDefVol(path));
  EXPECT_EQ(KLIBC_ERR_NO_SPACE, KLIBCErrGet());
  Volumes("[]");
  EXPECT_FALSE(PMSGetPackageDefVol(path));
  EXPECT_EQ(KLIBC_ERR_VOLUME_NOT_FOUND, KLIBCErrGet());
}

TEST_F(PMSTest, TemporarySpace) {
  std::string dir;
  ASSERT_TRUE(PMSGetTmpDir(1000, dir));
  EXPECT_EQ(0u, dir.find(root_.Path("/volume1/@tmp/kivo-pkg-"))) << dir;
  Volumes("[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 10}]");
  EXPECT_FALSE(PMSGetTmpDir(1000, dir));
  EXPECT_EQ(KLIBC_ERR_NO_SPACE, KLIBCErrGet());
  Volumes("[]");
  ASSERT_TRUE(PMSGetTmpDir(1000, dir));  // the root's /tmp when no volume can
  EXPECT_EQ(0u, dir.find(root_.Path("/tmp/"))) << dir;
  RunProgram({"rm", "-rf", root_.Path("/tmp")}, nullptr);
  root_.Write("/tmp", "not a folder");
  EXPECT_FALSE(PMSGetTmpDir(1000, dir));
  EXPECT_EQ(KLIBC_ERR_NO_TMP_DIR, KLIBCErrGet());

  Volumes("[{\"path\": \"/volume1\", \"status\": \"normal\"}]");
  std::string folder;
  ASSERT_TRUE(PMSCreateDownloadTmpDir("", "demo-web", 100, folder));
  EXPECT_NE(std::string::npos, folder.find("/volume1/@tmp/download-demo-web-"));
  EXPECT_FALSE(PMSCreateDownloadTmpDir("", "../../etc", 100, folder));
}

TEST_F(PMSTest, ProgressAndPackageFacts) {
  EXPECT_EQ(-1.0, PMSGetProgress("nothing-running"));
  EXPECT_EQ(-1.0, PMSGetProgress("../x"));
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
  TestPackage app;
  app.info = {{"os_min_ver", "7.1-0042"}, {"ctl_uninstall", "yes"}};
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", app.Build(root_.Path("/tmp"))}, &out)) << out;
  EXPECT_EQ(-1.0, PMSGetProgress("test-app"));  // none once the install is over
  PackageManager pm;
  PackageInfo info;
  ASSERT_TRUE(pm.getPackageInfo("test-app", info));
  int major, minor, build;
  PMSGetOSMinVer(info, major, minor, build);
  EXPECT_EQ(7, major);
  EXPECT_EQ(1, minor);
  EXPECT_EQ(42, build);
  PMSGetOSMaxVer(info, major, minor, build);
  EXPECT_EQ(0, major);
  EXPECT_TRUE(PMSGetCtlUninstall(info));
  std::string volume;
  EXPECT_TRUE(PMSGetPackageVol("test-app", volume));
  EXPECT_EQ("/volume1", volume);
  EXPECT_EQ(0u, PMSGetPackageTarget(info).find(root_.Path("/volume1/@appstore/test-app.")));
  EXPECT_EQ(1, PMSCheckPackage("test-app"));
  EXPECT_EQ(0, PMSCheckPackage("other"));
  root_.Write("/usr/kivo/etc/packages/restricted", "test-app 1.0\n");
  EXPECT_EQ(1, PMSThirdPartyCheckLimit("test-app", "1.0"));
  EXPECT_EQ(0, PMSThirdPartyCheckLimit("test-app", "1.1"));
}

}  // namespace
