#include <cstring>
#include <string>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>
#include <json/value.h>

#include "storage/device_info.h"
#include "storage/os_version.h"
#include "storage/service_state.h"
#include "storage/volume_list.h"
#include "storage/volume_lookup.h"
#include "storage/volume_space.h"
#include "storage/volumes.h"
#include "testing/temp_root.h"

namespace {

// A root whose volumes.json lists "/volume1" (normal, folder present), a
// brick "/volume2" capped at 4 KiB and a crashed "/volume3" without a folder.
class VolumesTest : public ::testing::Test {
 protected:
  VolumesTest() {
    root_.Write("/etc/kivo/volumes.json",
                R"([{"path": "/volume1"},
                    {"path": "/volume2", "status": "degraded", "cap_bytes": 4096, "brick": true},
                    {"path": "/volume3", "status": "crashed"}])");
    root_.Write("/volume2/share/file", "x");
  }
  VolumeConfig Find(const std::string& path) {
    VolumeConfig v;
    EXPECT_TRUE(KIVOVolumeFind(path, &v)) << path;
    return v;
  }
  TempRoot root_;
};

TEST_F(VolumesTest, LoadKeepsFileOrderAndFillsDefaults) {
  std::vector<VolumeConfig> volumes = KIVOVolumesLoad();
  ASSERT_EQ(3u, volumes.size());
  EXPECT_EQ("/volume1", volumes[0].path);
  EXPECT_EQ("normal", volumes[0].status);
  EXPECT_EQ(0u, volumes[0].cap_bytes);
  EXPECT_FALSE(volumes[0].brick);
  EXPECT_EQ("/volume2", volumes[1].path);
  EXPECT_TRUE(volumes[1].brick);
  EXPECT_TRUE(volumes[1].usable());
  EXPECT_FALSE(volumes[2].usable());
}

TEST_F(VolumesTest, LoadLeavesOutPathsThatAreNotAbsoluteOrClimb) {
  root_.Write("/etc/kivo/volumes.json",
              R"([{"path": "volume1"}, {"path": "/volume1/../etc"}, {"path": 7}, {"path": "/v"}])");
  std::vector<VolumeConfig> volumes = KIVOVolumesLoad();
  ASSERT_EQ(1u, volumes.size());
  EXPECT_EQ("/v", volumes[0].path);
}

TEST_F(VolumesTest, MissingOrMalformedFileConfiguresNoVolume) {
  root_.Write("/etc/kivo/volumes.json", "[{\"path\": \"/volume1\"},");
  EXPECT_TRUE(KIVOVolumesLoad().empty());
  ASSERT_EQ(0, unlink(KIVOVolumesFile().c_str()));
  EXPECT_TRUE(KIVOVolumesLoad().empty());
}

TEST_F(VolumesTest, FindAnswersTheVolumeHoldingAPath) {
  EXPECT_EQ("/volume1", Find("/volume1").path);
  EXPECT_EQ("/volume2", Find("/volume2/share/file").path);
  VolumeConfig v;
  EXPECT_FALSE(KIVOVolumeFind("/volume10/x", &v));
  EXPECT_FALSE(KIVOVolumeFind("/tmp", &v));
}

TEST_F(VolumesTest, SpaceIsCappedAndUnmeasuredIsMinusOne) {
  EXPECT_EQ(4096, KIVOVolumeFreeBytes(Find("/volume2")));
  EXPECT_EQ(4096, KIVOVolumeTotalBytes(Find("/volume2")));
  EXPECT_GT(KIVOVolumeFreeBytes(Find("/volume1")), 4096);
  EXPECT_GE(KIVOVolumeTotalBytes(Find("/volume1")), KIVOVolumeFreeBytes(Find("/volume1")));
  EXPECT_EQ(-1, KIVOVolumeFreeBytes(Find("/volume3")));
  EXPECT_EQ(-1, KIVOVolumeTotalBytes(Find("/volume3")));
}

TEST_F(VolumesTest, RealPathsLieOnTheirVolume) {
  std::string volume;
  ASSERT_EQ(0, VolumePathParseEx(root_.Path("/volume2/@appstore/x"), volume));
  EXPECT_EQ("/volume2", volume);
  EXPECT_EQ(-1, VolumePathParseEx("/volume2/@appstore/x", volume));  // not under the root
  EXPECT_EQ(-1, VolumePathParseEx(root_.Path("/etc/kivo"), volume));
  EXPECT_EQ(1, KIVOVolumeIsUsedByGlusterFs(root_.Path("/volume2/share")));
  EXPECT_EQ(0, KIVOVolumeIsUsedByGlusterFs(root_.Path("/volume1")));
  EXPECT_EQ(-1, KIVOVolumeIsUsedByGlusterFs(root_.Path("/tmp")));
}

TEST_F(VolumesTest, MountInfoOfAVolumeOnly) {
  KIVOMountVolInfo info;
  ASSERT_EQ(0, KIVOMountVolInfoGet("/volume2", &info));
  EXPECT_EQ(1, info.available);
  EXPECT_EQ(4096u, info.free_bytes);
  ASSERT_EQ(0, KIVOMountVolInfoGet("/volume3", &info));
  EXPECT_EQ(0, info.available);
  EXPECT_EQ(0u, info.free_bytes);
  EXPECT_EQ(-1, KIVOMountVolInfoGet("/volume2/share", &info));
  EXPECT_EQ(-1, KIVOMountVolInfoGet("/volume9", &info));
}

TEST_F(VolumesTest, ShareTmpPathIsTheVolumeTmpFolder) {
  char buf[4096];
  std::string expected = root_.Path("/volume2/@tmp");
  ASSERT_EQ(static_cast<int>(expected.size()),
            KIVOShareTmpPathGet(root_.Path("/volume2/share/file").c_str(), buf, sizeof(buf)));
  EXPECT_EQ(expected, buf);
  EXPECT_EQ(-1, KIVOShareTmpPathGet(root_.Path("/volume2/share").c_str(), buf,
                                    static_cast<int>(expected.size())));
  EXPECT_EQ(-1, KIVOShareTmpPathGet(root_.Path("/tmp/x").c_str(), buf, sizeof(buf)));
}

TEST_F(VolumesTest, ListShowsUsableVolumesUnlessAskedForAll) {
  Json::Value out;
  ASSERT_TRUE(KIVO::PXS::STORAGE_WEBUTILS::Volume(1).VolumeListGet(out, false));
  ASSERT_EQ(2u, out["volume_count"].asUInt());
  const Json::Value& v2 = out["volumes"][1];
  EXPECT_EQ("/volume2", v2["volume_path"].asString());
  EXPECT_EQ("degraded", v2["status"].asString());
  EXPECT_EQ("4096", v2["size_free_byte"].asString());
  EXPECT_EQ("4096", v2["size_total_byte"].asString());
  EXPECT_TRUE(v2["is_brick"].asBool());

  ASSERT_TRUE(KIVO::PXS::STORAGE_WEBUTILS::Volume(12).VolumeListGet(out, true));
  ASSERT_EQ(3u, out["volume_count"].asUInt());
  EXPECT_EQ("0", out["volumes"][2]["size_free_byte"].asString());
  EXPECT_EQ("0", out["volumes"][2]["size_total_byte"].asString());
}

TEST_F(VolumesTest, ListFailsWithoutConfigurationAndKeepsTheAnswer) {
  ASSERT_EQ(0, unlink(KIVOVolumesFile().c_str()));
  Json::Value out;
  out["kept"] = true;
  EXPECT_FALSE(KIVO::PXS::STORAGE_WEBUTILS::Volume(1).VolumeListGet(out, true));
  EXPECT_EQ(1u, out.size());
}

class DeviceTest : public ::testing::Test {
 protected:
  TempRoot root_;
};

TEST_F(DeviceTest, ReadsDeviceConfAndDefaultsWhatIsMissing) {
  root_.Write("/etc/kivo/device.conf", "os_version=\"7.3-0100\"\nkind=\"tinbox\"\narch=\"\"\n");
  DeviceInfo device = KIVODeviceLoad();
  EXPECT_EQ("7.3-0100", device.os_version);
  EXPECT_EQ("x86_64", device.arch);
  EXPECT_TRUE(KLIBCIsTinbox());
  ASSERT_EQ(0, unlink(root_.Path("/etc/kivo/device.conf").c_str()));
  EXPECT_EQ("7.2-0064", KIVODeviceLoad().os_version);
  EXPECT_FALSE(KLIBCIsTinbox());
}

class ServiceTest : public ::testing::Test {
 protected:
  TempRoot root_;
};

TEST_F(ServiceTest, OnlyAServiceSaidToRunIsRunning) {
  root_.Write("/etc/kivo/services.conf", "pgsql=\"running\"\nssh=\"stopped\"\n");
  EXPECT_TRUE(KIVOServiceRunning("pgsql"));
  EXPECT_FALSE(KIVOServiceRunning("ssh"));
  EXPECT_FALSE(KIVOServiceRunning("smb"));
  ASSERT_EQ(0, unlink(root_.Path("/etc/kivo/services.conf").c_str()));
  EXPECT_FALSE(KIVOServiceRunning("pgsql"));
}

TEST(OSVersionTest, ParsesMajorMinorBuild) {
  int major = 0, minor = 0, build = 0;
  ASSERT_TRUE(KIVOParseOSVersion("7.2-0064", &major, &minor, &build));
  EXPECT_EQ(7, major);
  EXPECT_EQ(2, minor);
  EXPECT_EQ(64, build);
  for (const char* bad : {"", "7.2", "7.2-64x", "7-2.64", "seven"}) {
    EXPECT_FALSE(KIVOParseOSVersion(bad, &major, &minor, &build)) << bad;
  }
}

TEST(OSVersionTest, ComparesNumbersNotText) {
  EXPECT_LT(KIVOCompareOSVersion("7.2-0064", "7.10-0001"), 0);
  EXPECT_GT(KIVOCompareOSVersion("7.2-0100", "7.2-0064"), 0);
  EXPECT_EQ(0, KIVOCompareOSVersion("7.2-64", "7.2-0064"));
  EXPECT_LT(KIVOCompareOSVersion("garbled", "0.0-1"), 0);
  EXPECT_EQ(0, KIVOCompareOSVersion("garbled", "0.0-0"));
}

}  // namespace
