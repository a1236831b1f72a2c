// Package icons and screenshots through the real host on a temporary root.

#include <cstdio>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>

#include "testing/cgi_client.h"
#include "testing/temp_root.h"

namespace {

const char kImages[] = "/usr/kivo/kivoman/webman/modules/PkgManApp/images/";

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

class ImageTest : public ::testing::Test {
 protected:
  void SetUp() override { root_.AddAccount("admin", "secret", {"administrators"}); }

  // A registry record as the package tool leaves it, with the given members.
  void Install(const std::string& id, const std::string& version,
               const std::map<std::string, std::string>& members) {
    root_.Write("/var/packages/" + id + "/INFO",
                "package=\"" + id + "\"\nversion=\"" + version + "\"\n");
    for (const auto& m : members) root_.Write("/var/packages/" + id + "/" + m.first, m.second);
  }

  CgiAnswer Get(const std::string& api, const Params& params) {
    return ApiClient("admin", "secret").Call(api, "get", 1, params);
  }

  std::string Fallback(const std::string& name) { return ReadFile(root_.Path(kImages + name)); }

  TempRoot root_;
};

// An image answer: the file's bytes, its length and the cache time.
void ExpectImage(const CgiAnswer& a, const std::string& bytes, int max_age) {
  EXPECT_EQ(0, a.exit_status);
  EXPECT_NE(std::string::npos,
            a.head.find("Cache-Control: max-age=" + std::to_string(max_age) + "\r\n"))
      << a.head;
  EXPECT_NE(std::string::npos, a.head.find("Content-Type: image/jpeg\r\n")) << a.head;
  EXPECT_NE(std::string::npos, a.head.find("Content-Length: " + std::to_string(bytes.size())))
      << a.head;
  EXPECT_EQ(std::string::npos, a.head.find("application/json")) << a.head;
  EXPECT_TRUE(a.body == bytes) << a.body.size() << " bytes instead of " << bytes.size();
}

TEST_F(ImageTest, FallbackIconsAreRealPngImages) {
  for (const char* name :
       {"package_center_72.png", "package_center_256.png", "package_center_256.png.png"}) {
    std::string png = Fallback(name);
    ASSERT_GT(png.size(), 24u) << name;
    EXPECT_EQ(std::string("\x89PNG\r\n\x1a\n", 8), png.substr(0, 8)) << name;
    // The IHDR chunk's width: 72 or 256 pixels.
    unsigned width = static_cast<unsigned char>(png[18]) << 8 | static_cast<unsigned char>(png[19]);
    EXPECT_EQ(std::string(name).find("72") != std::string::npos ? 72u : 256u, width) << name;
  }
}

TEST_F(ImageTest, InstalledIconsBySize) {
  Install("demo-web", "1.0",
          {{"PACKAGE_ICON.PNG", "small icon"}, {"PACKAGE_ICON_256.PNG", "large"}});
  Install("small-only", "2.0", {{"PACKAGE_ICON.PNG", "only small"}});
  Params web = {{"name", "demo-web"}, {"ver", "1.0"}};
  auto with_size = [](Params p, const char* size) {
    p.push_back({"size", size});
    return p;
  };
  ExpectImage(Get("KIVO.Core.Package.Thumb", with_size(web, "72")), "small icon", 2592000);
  for (const char* size : {"128", "144", "256"}) {
    ExpectImage(Get("KIVO.Core.Package.Thumb", with_size(web, size)), "large", 2592000);
  }
  // The large sizes take the small icon when there is no large one.
  ExpectImage(
      Get("KIVO.Core.Package.Thumb", {{"name", "small-only"}, {"ver", "2.0"}, {"size", "256"}}),
      "only small", 2592000);
  // 96 and 100 are no size of installed icons: no lookup, the fallback.
  for (const char* size : {"96", "100"}) {
    ExpectImage(Get("KIVO.Core.Package.Thumb", with_size(web, size)),
                Fallback("package_center_256.png"), 10);
  }
}

TEST_F(ImageTest, InstalledIconFallbacks) {
  Install("demo-web", "1.0", {{"PACKAGE_ICON.PNG", "small icon"}});
  std::string fb72 = Fallback("package_center_72.png");
  std::string fb256 = Fallback("package_center_256.png");
  // No version, another version, an unknown or hostile name, no icon file.
  ExpectImage(Get("KIVO.Core.Package.Thumb", {{"name", "demo-web"}, {"size", "72"}}), fb72, 10);
  ExpectImage(Get("KIVO.Core.Package.Thumb", {{"name", "demo-web"}, {"ver", ""}, {"size", "72"}}),
              fb72, 10);
  ExpectImage(
      Get("KIVO.Core.Package.Thumb", {{"name", "demo-web"}, {"ver", "0.9"}, {"size", "72"}}), fb72,
      10);
  ExpectImage(Get("KIVO.Core.Package.Thumb", {{"name", "../demo-web"}, {"ver", "1.0"}}), fb256, 10);
  ExpectImage(
      Get("KIVO.Core.Package.Thumb", {{"name", "nothing"}, {"ver", "1.0"}, {"size", "256"}}), fb256,
      10);
  // Even the fallback gone: the host's default answer, not a crash.
  ASSERT_EQ(0, remove(root_.Path(std::string(kImages) + "package_center_72.png").c_str()));
  CgiAnswer a = Get("KIVO.Core.Package.Thumb", {{"name", "x"}, {"size", "72"}});
  EXPECT_FALSE(a.Success());
  EXPECT_EQ(100, a.Code()) << a.body;
}

TEST_F(ImageTest, ServerIconFallbacksKeepTheDoubledExtension) {
  std::string fb72 = Fallback("package_center_72.png");
  std::string fb256 = Fallback("package_center_256.png.png");
  // Nothing cached and no link: the fallbacks.
  Params p = {{"name", "remote"}, {"ver", "1.0"}, {"bls", "false"}};
  auto with_size = [](Params q, const char* size) {
    q.push_back({"size", size});
    return q;
  };
  ExpectImage(Get("KIVO.Core.Package.Thumb.Server", with_size(p, "72")), fb72, 10);
  ExpectImage(Get("KIVO.Core.Package.Thumb.Server", with_size(p, "256")), fb256, 10);
  // A cached server icon is served for 30 days; 96 is a large size here.
  root_.Write("/var/cache/kivo/pkgserver/images/other/remote/1.0/thumb_256.png", "big");
  ExpectImage(Get("KIVO.Core.Package.Thumb.Server", with_size(p, "96")), "big", 2592000);
  // Without the doubled-extension file, a large size sends nothing at all.
  ASSERT_EQ(0, remove(root_.Path(std::string(kImages) + "package_center_256.png.png").c_str()));
  CgiAnswer a = Get("KIVO.Core.Package.Thumb.Server", {{"name", "other"}, {"size", "256"}});
  EXPECT_EQ(100, a.Code()) << a.body;
}

TEST_F(ImageTest, Screenshots) {
  Install("demo-web", "1.0", {{"SCREENSHOT_1.PNG", "first shot"}});
  ExpectImage(
      Get("KIVO.Core.Package.Screenshot", {{"name", "demo-web"}, {"ver", "1.0"}, {"index", "1"}}),
      "first shot", 2592000);
  CgiAnswer missing =
      Get("KIVO.Core.Package.Screenshot", {{"name", "demo-web"}, {"ver", "1.0"}, {"index", "2"}});
  EXPECT_EQ(4586, missing.Code()) << missing.body;
  // A number sent as text is a type fault of the checker (120).
  EXPECT_EQ(120, Get("KIVO.Core.Package.Screenshot",
                     {{"name", "demo-web"}, {"ver", "1.0"}, {"index", "\"1\""}})
                     .Code());
  for (const char* index : {"0", "9"}) {
    CgiAnswer bad = Get("KIVO.Core.Package.Screenshot",
                        {{"name", "demo-web"}, {"ver", "1.0"}, {"index", index}});
    EXPECT_EQ(4500, bad.Code()) << index << bad.body;
  }
  root_.Write("/var/cache/kivo/pkgserver/images/kivo/remote/2.0/screenshot_3.png", "shot");
  ExpectImage(Get("KIVO.Core.Package.Screenshot.Server",
                  {{"name", "remote"}, {"ver", "2.0"}, {"index", "3"}, {"bls", "true"}}),
              "shot", 2592000);
  CgiAnswer none = Get("KIVO.Core.Package.Screenshot.Server",
                       {{"name", "remote"}, {"ver", "2.0"}, {"index", "4"}});
  EXPECT_EQ(4586, none.Code()) << none.body;
}

}  // namespace
