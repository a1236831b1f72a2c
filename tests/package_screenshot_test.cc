// Screenshots carried in a package file: built by kivoctl, installed into the
// package's record and served by "Screenshot" "get", extracted by the
// catalogue index beside the catalogue.

#include <gtest/gtest.h>
#include <json/reader.h>

#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

class PackageScreenshotTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(1);  // unsigned test packages install at trust level 1
    shots_.id = "shots";
    shots_.version = "1.2";
    shots_.members = {{"SCREENSHOT_1.PNG", "first picture"}, {"SCREENSHOT_2.PNG", "second"}};
  }

  CgiAnswer Screenshot(const char* index) {
    return client().Call("KIVO.Core.Package.Screenshot", "get", 1,
                         {{"name", "shots"}, {"ver", "1.2"}, {"index", index}});
  }

  TestPackage shots_;
};

TEST_F(PackageScreenshotTest, InstalledScreenshotsAreServed) {
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", shots_.Build(root_.Path("/tmp"))}, &out)) << out;
  EXPECT_EQ("first picture", Screenshot("1").body);
  EXPECT_EQ("second", Screenshot("2").body);
  EXPECT_EQ(4586, Screenshot("3").Code());
}

TEST_F(PackageScreenshotTest, BuilderRefusesAScreenshotPastTheEighth) {
  root_.Write("/src/INFO", "package=\"shots\"\nversion=\"1.2\"\n");
  root_.Write("/src/package/readme", "hello");
  root_.Write("/src/SCREENSHOT_9.PNG", "one too many");
  std::string out;
  EXPECT_NE(0, Kivoctl({"build", root_.Path("/src"), root_.Path("/shots.kpk")}, &out));
  EXPECT_NE(std::string::npos, out.find("SCREENSHOT_9.PNG")) << out;
}

TEST_F(PackageScreenshotTest, CatalogueIndexExtractsScreenshots) {
  std::string folder = root_.Path("/srv/catalogue");
  shots_.Build(folder);
  std::string out;
  ASSERT_EQ(0, Kivoctl({"index", folder, "--base-url", "http://pkg.example/kivo"}, &out)) << out;
  EXPECT_EQ("first picture", FileText(folder + "/screenshots/shots-1.2/screenshot_1.png"));
  EXPECT_EQ("second", FileText(folder + "/screenshots/shots-1.2/screenshot_2.png"));
  Json::Value catalogue;
  ASSERT_TRUE(Json::Reader().parse(FileText(folder + "/catalogue.json"), catalogue));
  const Json::Value& entry = catalogue["packages"][0];
  ASSERT_EQ(2u, entry["screenshots"].size()) << catalogue.toStyledString();
  EXPECT_EQ("http://pkg.example/kivo/screenshots/shots-1.2/screenshot_2.png",
            entry["screenshots"][1].asString());
}

}  // namespace
