// Package icons and screenshots through the real host on a temporary root.

#include <array>
#include <chrono>
#include <cstdio>
#include <thread>
#include <unistd.h>

#include <gtest/gtest.h>

#include "pkgserver/server_net.h"
#include "pkgtool/package_file.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

const char kImages[] = "/usr/kivo/kivoman/webman/modules/PkgManApp/images/";

class ImageTest : public AdminApiTest {
 protected:
  // A registry record as the package tool leaves it, with the given members.
  void Install(const std::string& id, const std::string& version,
               const std::map<std::string, std::string>& members) {
    root_.Write("/var/packages/" + id + "/INFO",
                "package=\"" + id + "\"\nversion=\"" + version + "\"\n");
    for (const auto& m : members) root_.Write("/var/packages/" + id + "/" + m.first, m.second);
  }

  CgiAnswer Get(const std::string& api, const Params& params) {
    return client().Call(api, "get", 1, params);
  }

  std::string Fallback(const std::string& name) { return FileText(root_.Path(kImages + name)); }
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
  // No link: the fallbacks (ServerImageTest has the icons that links name).
  Params p = {{"name", "remote"}, {"ver", "1.0"}, {"bls", "false"}};
  auto with_size = [](Params q, const char* size) {
    q.push_back({"size", size});
    return q;
  };
  ExpectImage(Get("KIVO.Core.Package.Thumb.Server", with_size(p, "72")), fb72, 10);
  for (const char* size : {"96", "256"}) {
    ExpectImage(Get("KIVO.Core.Package.Thumb.Server", with_size(p, size)), fb256, 10);
  }
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
  // A server screenshot without a link cannot be had.
  CgiAnswer none = Get("KIVO.Core.Package.Screenshot.Server",
                       {{"name", "remote"}, {"ver", "2.0"}, {"index", "4"}});
  EXPECT_EQ(4586, none.Code()) << none.body;
}

// Icons and screenshots of server packages, fetched from loopback servers
// that stand for the vendor's package server, feeds and an internal host.
// Images are fetched only from the catalogues' servers, from public
// addresses unless the root allows private ones, and only when they are
// images; the cache is keyed by the address.

constexpr char kThumbServer[] = "KIVO.Core.Package.Thumb.Server";
constexpr char kShotServer[] = "KIVO.Core.Package.Screenshot.Server";

// An image by its content: a PNG signature and some bytes.
std::string Png(const std::string& tag) { return std::string("\x89PNG\r\n\x1a\n", 8) + tag; }

HttpRoute Serve(const std::string& body) {
  HttpRoute route;
  route.body = body;
  return route;
}

HttpRoute RedirectTo(const std::string& location) {
  HttpRoute route;
  route.status = 302;
  route.location = location;
  return route;
}

class ServerImageTest : public ImageTest {
 protected:
  void SetUp() override {
    for (HttpTestServer* s : {&vendor_, &feed_, &feed2_, &internal_}) {
      s->Set("/catalogue.json", Serve("{\"packages\": [], \"recommend\": []}"));
    }
    vendor_.Set("/icon.png", Serve(Png("vendor icon")));
    vendor_.Set("/shot.png", Serve(Png("vendor screenshot")));
    internal_.Set("/private/secret.png", Serve(Png("internal secret")));
  }

  // pkgserver.conf: the vendor's catalogue at `vendor_url`, private
  // addresses allowed or not.
  void Configure(bool allow_private, const std::string& vendor_url) {
    root_.Write("/etc/kivo/pkgserver.conf",
                VendorConf(vendor_url,
                           std::string("catalogue_timeout=\"5\"\n") +
                               (allow_private ? "allow_private_image_addresses=\"yes\"\n" : "")));
  }
  void Configure(bool allow_private) { Configure(allow_private, vendor_.Url("/catalogue.json")); }

  void SetFeeds(const std::vector<std::string>& urls) {
    Json::Value feeds(Json::arrayValue);
    for (const std::string& url : urls) {
      Json::Value feed;
      feed["feed"] = url;
      feeds.append(feed);
    }
    root_.Write("/usr/kivo/etc/packages/feeds", feeds.toStyledString());
  }

  CgiAnswer Icon(const std::string& name, const std::string& ver, const std::string& link) {
    return Get(kThumbServer, {{"name", name}, {"ver", ver}, {"size", "72"}, {"link", link}});
  }
  CgiAnswer Shot(const std::string& name, const std::string& ver, const std::string& link) {
    return Get(kShotServer, {{"name", name}, {"ver", ver}, {"index", "1"}, {"link", link}});
  }
  void ExpectFallback(const CgiAnswer& a) { ExpectImage(a, Fallback("package_center_72.png"), 10); }

  HttpTestServer vendor_, feed_, feed2_, internal_;
};

TEST_F(ServerImageTest, LoopbackAddressesAreRefusedUnlessTheRootAllowsThem) {
  Configure(false);
  ExpectFallback(Icon("demo", "1.0", vendor_.Url("/icon.png")));
  EXPECT_EQ(4586, Shot("demo", "1.0", vendor_.Url("/shot.png")).Code());
  EXPECT_EQ(0, vendor_.Requests("/icon.png"));
  EXPECT_EQ(0, vendor_.Requests("/shot.png"));
  // The address is judged after the name is resolved: a name for loopback
  // is loopback.
  const std::string by_name = "http://localhost:" + std::to_string(vendor_.port());
  Configure(false, by_name + "/catalogue.json");
  ExpectFallback(Icon("demo", "1.0", by_name + "/icon.png"));
  EXPECT_EQ(0, vendor_.Requests("/icon.png"));
  // The root's setting lets them through.
  std::string out;
  ASSERT_EQ(0, Kivoctl({"server-config", "--allow-private-image-addresses", "yes"}, &out)) << out;
  EXPECT_NE(std::string::npos, out.find("allow_private_image_addresses=yes")) << out;
  ExpectImage(Icon("demo", "1.0", by_name + "/icon.png"), Png("vendor icon"), 2592000);
  ExpectImage(Shot("demo", "1.0", by_name + "/shot.png"), Png("vendor screenshot"), 2592000);
  EXPECT_EQ(1, vendor_.Requests("/icon.png"));
  // And takes them back.
  ASSERT_EQ(0, Kivoctl({"server-config", "--allow-private-image-addresses", "no"}, &out)) << out;
  ExpectFallback(Icon("other", "1.0", by_name + "/icon.png"));
  EXPECT_EQ(1, vendor_.Requests("/icon.png"));
}

// The transfer that fetches images refuses every address that is not on
// the public internet, judged after the name is resolved and before any
// connection is made (so these fail at once, with no network).
TEST(ImageAddressTest, NonPublicAddressesAreRefusedBeforeConnecting) {
  std::string error;
  const PackageServerNetOps* net = PMSServerNetOps(&error);
  ASSERT_NE(nullptr, net) << error;
  const std::pair<const char*, const char*> kRefused[] = {
      {"http://127.0.0.2:9/", "127.0.0.2"},
      {"http://2130706433:9/", "127.0.0.1"},  // 127.0.0.1 as one number
      {"http://localhost:9/", ""},            // 127.0.0.1 or ::1
      {"http://0.0.0.0:9/", "0.0.0.0"},
      {"http://10.1.2.3:9/", "10.1.2.3"},
      {"http://172.20.0.1:9/", "172.20.0.1"},
      {"http://192.168.1.1:9/", "192.168.1.1"},
      {"http://100.64.0.1:9/", "100.64.0.1"},
      {"http://169.254.169.254/", "169.254.169.254"},
      {"http://224.0.0.1:9/", "224.0.0.1"},
      {"http://[::1]:9/", "::1"},
      {"http://[::ffff:127.0.0.1]:9/", "::ffff:127.0.0.1"},
      {"http://[64:ff9b::a00:1]:9/", "64:ff9b::a00:1"},      // NAT64 of 10.0.0.1
      {"http://[2002:c0a8:101::1]:9/", "2002:c0a8:101::1"},  // 6to4 of 192.168.1.1
      {"http://[fd00::1]:9/", "fd00::1"},
      {"http://[fe80::1]:9/", "fe80::1"},
      {"http://[ff02::1]:9/", "ff02::1"}};
  for (const auto& [url, address] : kRefused) {
    HttpFetch fetch;
    fetch.url = url;
    fetch.public_only = true;
    HttpLimits limits;
    limits.connect_timeout_s = 2;
    EXPECT_FALSE(net->fetch(limits, fetch)) << url;
    EXPECT_NE(std::string::npos, fetch.error.find("not a public address"))
        << url << ": " << fetch.error;
    EXPECT_NE(std::string::npos, fetch.error.find(std::string("connecting to ") + address))
        << url << ": " << fetch.error;
  }
}

TEST_F(ServerImageTest, OnlyTheCataloguesServersAreAsked) {
  Configure(true);
  SetFeeds({feed_.Url("/catalogue.json")});
  feed_.Set("/icon.png", Serve(Png("feed icon")));
  // A host that serves no catalogue of the root: not asked, also not for a
  // screenshot.
  ExpectFallback(Icon("demo", "1.0", internal_.Url("/private/secret.png")));
  EXPECT_EQ(4586, Shot("demo", "1.0", internal_.Url("/private/secret.png")).Code());
  EXPECT_EQ(0, internal_.Requests("/private/secret.png"));
  // The vendor's host under another name is another host.
  ExpectFallback(
      Icon("demo", "1.0", "http://localhost:" + std::to_string(vendor_.port()) + "/icon.png"));
  EXPECT_EQ(0, vendor_.Requests("/icon.png"));
  // A redirect is held to the same rule: it may stay on the catalogues'
  // servers, not leave them.
  vendor_.Set("/to-internal.png", RedirectTo(internal_.Url("/private/secret.png")));
  ExpectFallback(Icon("demo", "1.0", vendor_.Url("/to-internal.png")));
  EXPECT_EQ(1, vendor_.Requests("/to-internal.png"));
  EXPECT_EQ(0, internal_.Requests("/private/secret.png"));
  vendor_.Set("/to-feed.png", RedirectTo(feed_.Url("/icon.png")));
  ExpectImage(Icon("demo", "1.0", vendor_.Url("/to-feed.png")), Png("feed icon"), 2592000);
  // The vendor's and the feed's own addresses.
  ExpectImage(Icon("demo", "1.0", vendor_.Url("/icon.png")), Png("vendor icon"), 2592000);
  ExpectImage(Icon("demo", "1.0", feed_.Url("/icon.png")), Png("feed icon"), 2592000);
}

TEST_F(ServerImageTest, OnlyImagesAreKept) {
  Configure(true);
  vendor_.Set("/page.png", Serve("<html><body>an internal page</body></html>"));
  ExpectFallback(Icon("demo", "1.0", vendor_.Url("/page.png")));
  EXPECT_EQ(4586, Shot("demo", "1.0", vendor_.Url("/page.png")).Code());
  // Nothing was kept: each request asks again.
  ExpectFallback(Icon("demo", "1.0", vendor_.Url("/page.png")));
  EXPECT_EQ(3, vendor_.Requests("/page.png"));
  // JPEG, GIF and WebP images are images too, whatever their names.
  const std::string jpeg = std::string("\xff\xd8\xff\xe0", 4) + "jpeg";
  const std::string gif = "GIF89a gif";
  const std::string webp = std::string("RIFF\x10\0\0\0WEBPVP8 ", 16) + "webp";
  vendor_.Set("/a", Serve(jpeg));
  vendor_.Set("/b", Serve(gif));
  vendor_.Set("/c", Serve(webp));
  ExpectImage(Icon("demo", "1.0", vendor_.Url("/a")), jpeg, 2592000);
  ExpectImage(Icon("demo", "1.0", vendor_.Url("/b")), gif, 2592000);
  ExpectImage(Shot("demo", "1.0", vendor_.Url("/c")), webp, 2592000);
}

TEST_F(ServerImageTest, EachFeedKeepsItsOwnImages) {
  Configure(true);
  SetFeeds({feed_.Url("/catalogue.json"), feed2_.Url("/catalogue.json")});
  feed_.Set("/icons/demo-1.0.png", Serve(Png("first feed")));
  feed2_.Set("/icons/demo-1.0.png", Serve(Png("second feed")));
  feed_.Set("/shot.png", Serve(Png("first feed's screenshot")));
  feed2_.Set("/shot.png", Serve(Png("second feed's screenshot")));
  // The same package id and version on both feeds: each link gets its own
  // feed's picture, first asked or not.
  for (int round = 0; round < 2; ++round) {
    ExpectImage(Icon("demo", "1.0", feed_.Url("/icons/demo-1.0.png")), Png("first feed"), 2592000);
    ExpectImage(Icon("demo", "1.0", feed2_.Url("/icons/demo-1.0.png")), Png("second feed"),
                2592000);
    ExpectImage(Shot("demo", "1.0", feed2_.Url("/shot.png")), Png("second feed's screenshot"),
                2592000);
    ExpectImage(Shot("demo", "1.0", feed_.Url("/shot.png")), Png("first feed's screenshot"),
                2592000);
  }
  // The second round came from the cache.
  EXPECT_EQ(1, feed_.Requests("/icons/demo-1.0.png"));
  EXPECT_EQ(1, feed2_.Requests("/icons/demo-1.0.png"));
}

// Serves a feed catalogue at `server`'s "/catalogue.json" whose entries are
// (id, version, icon).
void PublishCatalogue(HttpTestServer& server,
                      const std::vector<std::array<std::string, 3>>& entries) {
  Json::Value catalogue;
  catalogue["recommend"] = Json::Value(Json::arrayValue);
  for (const auto& [id, version, icon] : entries) {
    Json::Value entry;
    entry["package"] = id;
    entry["version"] = version;
    entry["icon"] = icon;
    catalogue["packages"].append(entry);
  }
  server.Set("/catalogue.json", Serve(catalogue.toStyledString()));
}

// Waits (at most 20 seconds) until `done` holds; whether it does.
template <typename Done>
bool Await(Done done) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (!done() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return done();
}

// Lists the feeds' catalogues and waits until the background child asks
// `server` for `path`. The child fetches icons in catalogue order, one after
// the other: once it asks for one, every entry before it was judged.
void ListAndAwaitRequest(HttpTestServer& server, const std::string& path) {
  CgiAnswer list = ApiClient("admin", "secret")
                       .Call("KIVO.Core.Package.Server", "list", 1, {{"blloadothers", "true"}});
  ASSERT_TRUE(list.Success()) << list.body;
  ASSERT_TRUE(Await([&] { return server.Requests(path) > 0; })) << path;
}

// Listing a catalogue fetches its icons in the background, under the same
// rules: an icon on a host that serves no catalogue is never asked for.
TEST_F(ServerImageTest, ListingFetchesIconsOnlyFromTheCataloguesServers) {
  Configure(true);
  SetFeeds({feed_.Url("/catalogue.json")});
  const std::string outside = feed_.Url("/icons/outside-1.0.png");
  feed_.Set("/icons/outside-1.0.png", Serve(Png("listed icon")));
  PublishCatalogue(feed_, {{"inside", "1.0", internal_.Url("/private/secret.png")},
                           {"outside", "1.0", outside}});
  ListAndAwaitRequest(feed_, "/icons/outside-1.0.png");
  EXPECT_EQ(0, internal_.Requests("/private/secret.png"));
  // The listed icon is cached under its address, and served from there.
  const std::string cached =
      root_.Path("/var/cache/kivo/pkgserver/images/outside/1.0/") + PMSSha256Hex(outside);
  ASSERT_TRUE(Await([&] { return access(cached.c_str(), F_OK) == 0; })) << cached;
  ExpectImage(Icon("outside", "1.0", outside), Png("listed icon"), 2592000);
  EXPECT_EQ(1, feed_.Requests("/icons/outside-1.0.png"));
}

// The page asks for the icons right after the listing answers, while the
// listing's background child is still fetching them (the image server is
// slow here, so the two always meet): the request waits for that fetch and
// serves its image, and the image server is asked once, not once by the
// child and once by the request.
TEST_F(ServerImageTest, IconAskedRightAfterTheListingWaitsForItsFetch) {
  Configure(true);
  SetFeeds({feed_.Url("/catalogue.json")});
  ApiClient client("admin", "secret");
  for (int round = 0; round < 4; ++round) {
    const std::string version = "1." + std::to_string(round);
    const std::string path = "/icons/demo-" + version + ".png";
    HttpRoute slow = Serve(Png("icon " + version));
    slow.delay_ms = 1000;
    feed_.Set(path, slow);
    PublishCatalogue(feed_, {{"demo", version, feed_.Url(path)}});
    CgiAnswer list = client.Call("KIVO.Core.Package.Server", "list", 1,
                                 {{"blloadothers", "true"}, {"blforcereload", "true"}});
    ASSERT_TRUE(list.Success()) << list.body;
    ExpectImage(Icon("demo", version, feed_.Url(path)), Png("icon " + version), 2592000);
    EXPECT_EQ(1, feed_.Requests(path)) << "round " << round;
  }
  // The wait is bounded: a fetch in flight that outlasts it (the root lets
  // a fetch take longer than the server's delay) leaves the request the
  // fallback (cached for seconds only), and the server is still asked once.
  root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor_.Url("/catalogue.json"),
                                                     "catalogue_timeout=\"30\"\n"
                                                     "allow_private_image_addresses=\"yes\"\n"));
  const std::string path = "/icons/demo-2.0.png";
  HttpRoute slower = Serve(Png("late icon"));
  slower.delay_ms = 8000;
  feed_.Set(path, slower);
  PublishCatalogue(feed_, {{"demo", "2.0", feed_.Url(path)}});
  ASSERT_TRUE(client
                  .Call("KIVO.Core.Package.Server", "list", 1,
                        {{"blloadothers", "true"}, {"blforcereload", "true"}})
                  .Success());
  ASSERT_TRUE(Await([&] { return feed_.Requests(path) > 0; }));
  ExpectFallback(Icon("demo", "2.0", feed_.Url(path)));
  EXPECT_EQ(1, feed_.Requests(path));
}

// A catalogue's id or version with a NUL byte in it is no id or version:
// it never names the image of the text before the NUL, and its icon is
// not fetched.
TEST_F(ServerImageTest, NulInIdOrVersionIsRefused) {
  Configure(true);
  SetFeeds({feed_.Url("/catalogue.json")});
  feed_.Set("/nul-id.png", Serve(Png("icon of a NUL id")));
  feed_.Set("/nul-version.png", Serve(Png("icon of a NUL version")));
  feed_.Set("/good.png", Serve(Png("good icon")));
  PublishCatalogue(feed_, {{std::string("demo\0../x", 9), "1.0", feed_.Url("/nul-id.png")},
                           {"demo", std::string("1.0\0x", 5), feed_.Url("/nul-version.png")},
                           {"good", "1.0", feed_.Url("/good.png")}});
  ListAndAwaitRequest(feed_, "/good.png");
  EXPECT_EQ(0, feed_.Requests("/nul-id.png"));
  EXPECT_EQ(0, feed_.Requests("/nul-version.png"));
  EXPECT_EQ(0, CountEntries(root_.Path("/var/cache/kivo/pkgserver/images"), "demo"));
}

}  // namespace
