// How fresh the catalogue is, through the real host: "Sources" "list" after
// listings of a vendor's catalogue and feeds that a loopback server serves,
// while a feed goes down and comes back, answers an error, answers JSON that
// is no catalogue, or lists nothing; "blforcereload" asks every server
// again, a fresh cache asks none.

#include <ctime>
#include <memory>

#include <gtest/gtest.h>

#include "klibc/json_text.h"
#include "pkgserver/source_status.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"

namespace {

constexpr char kServer[] = "KIVO.Core.Package.Server";
constexpr char kSources[] = "KIVO.Core.Package.Sources";
constexpr char kFeedApi[] = "KIVO.Core.Package.Feed";
constexpr char kFeedFile[] = "/usr/kivo/etc/packages/feeds";

class CatalogueFreshnessTest : public AdminApiTest {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor_.Url(), "catalogue_timeout=\"2\"\n"));
    TestPackage a;
    a.id = "vendor-app";
    ASSERT_TRUE(vendor_.Offer(a));
    TestPackage b;
    b.id = "feed-app";
    ASSERT_TRUE(feed_.Offer(b));
    Json::Value feeds(Json::arrayValue);
    feeds.append(FeedItem(feed_.Url(), "Our feed"));
    root_.Write(kFeedFile, KIVOWriteJson(feeds));
  }

  static Json::Value FeedItem(const std::string& url, const std::string& name) {
    Json::Value item(Json::objectValue);
    item["feed"] = url;
    item["name"] = name;
    return item;
  }

  CgiAnswer ListFeeds(bool reload) {
    Params params = {{"blloadothers", "true"}};
    if (reload) params.push_back({"blforcereload", "true"});
    return client().Call(kServer, "list", 1, params);
  }
  CgiAnswer ListVendor(bool reload) {
    return client().Call(kServer, "list", 1, reload ? Params{{"blforcereload", "true"}} : Params{});
  }
  // The source of `url` in "Sources" "list"; null when it lists none.
  Json::Value Source(const std::string& url) {
    CgiAnswer a = client().Call(kSources, "list", 1);
    EXPECT_TRUE(a.Success()) << a.body;
    for (const Json::Value& s : a.Data()["sources"]) {
      if (s["url"].asString() == url) return s;
    }
    return Json::Value();
  }

  HttpTestServer server_;
  CatalogueFeed vendor_{server_, root_.Path("/vendor"), "/vendor"};
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
};

TEST_F(CatalogueFreshnessTest, AFeedThatGoesDownIsFailingWithItsLastGoodTime) {
  const int64_t before = time(nullptr);
  ASSERT_TRUE(ListVendor(false).Success());
  ASSERT_TRUE(ListFeeds(false).Success());
  CgiAnswer all = client().Call(kSources, "list", 1);
  ASSERT_TRUE(all.Success()) << all.body;
  ASSERT_EQ(2u, all.Data()["sources"].size()) << all.body;
  EXPECT_EQ("vendor", all.Data()["sources"][0]["kind"].asString());
  EXPECT_EQ("feed", all.Data()["sources"][1]["kind"].asString());
  EXPECT_EQ("Our feed", all.Data()["sources"][1]["name"].asString());
  EXPECT_GE(all.Data()["now"].asInt64(), before);

  Json::Value good = Source(feed_.Url());
  ASSERT_EQ("ok", good["state"].asString()) << good;
  const int64_t last_good = good["last_success"].asInt64();
  EXPECT_GE(last_good, before);
  EXPECT_TRUE(good["failing_since"].isNull()) << good;
  EXPECT_EQ(1, good["packages"].asInt()) << good;
  EXPECT_EQ("ok", Source(vendor_.Url())["state"].asString());

  // The feed's server answers an error: a forced reload finds it failing,
  // since then, and why; its last good fetch is kept.
  feed_.PublishRaw("gone", 503);
  CgiAnswer failed = ListFeeds(true);
  Json::Value bad = Source(feed_.Url());
  ASSERT_EQ("failing", bad["state"].asString()) << bad << failed.body;
  EXPECT_EQ(last_good, bad["last_success"].asInt64());
  const int64_t since = bad["failing_since"].asInt64();
  EXPECT_GE(since, last_good);
  EXPECT_EQ("the server answered HTTP 503", bad["error"].asString());
  EXPECT_EQ(1, bad["packages"].asInt()) << "the count of the last good catalogue stays";
  // The vendor's server, asked again too, is still fine.
  ASSERT_TRUE(ListVendor(true).Success());
  EXPECT_EQ("ok", Source(vendor_.Url())["state"].asString());

  // JSON that is no catalogue is a failure too, still since the first one.
  feed_.PublishRaw(R"({"hello": "world"})");
  (void)ListFeeds(true);
  bad = Source(feed_.Url());
  EXPECT_EQ("failing", bad["state"].asString()) << bad;
  EXPECT_EQ(since, bad["failing_since"].asInt64());
  EXPECT_EQ("the answer is neither an array nor an object with \"packages\"",
            bad["error"].asString());

  // It comes back: ok again, failing no more.
  feed_.Publish();
  ASSERT_TRUE(ListFeeds(true).Success());
  good = Source(feed_.Url());
  EXPECT_EQ("ok", good["state"].asString()) << good;
  EXPECT_TRUE(good["failing_since"].isNull()) << good;
  EXPECT_EQ("", good["error"].asString());
}

TEST_F(CatalogueFreshnessTest, AFeedWhoseServerStopsIsFailingBesideAGoodOne) {
  auto other_server = std::make_unique<HttpTestServer>();
  CatalogueFeed other(*other_server, root_.Path("/other"), "/other");
  TestPackage c;
  c.id = "other-app";
  ASSERT_TRUE(other.Offer(c));
  const std::string other_url = other.Url();
  Json::Value feeds(Json::arrayValue);
  feeds.append(FeedItem(feed_.Url(), "Our feed"));
  feeds.append(FeedItem(other_url, "Other feed"));
  root_.Write(kFeedFile, KIVOWriteJson(feeds));
  ASSERT_TRUE(ListFeeds(false).Success());
  const int64_t last_good = Source(other_url)["last_success"].asInt64();
  ASSERT_GT(last_good, 0);

  // The server goes away: nothing listens on its port any more. The listing
  // still answers with the good feed's packages, and the record says which
  // feed failed and why.
  other_server.reset();
  CgiAnswer listed = ListFeeds(true);
  ASSERT_TRUE(listed.Success()) << listed.body;
  EXPECT_EQ(feed_.Url(), CatalogueEntry(listed, "feed-app")["feed"].asString()) << listed.body;
  EXPECT_TRUE(CatalogueEntry(listed, "other-app").isNull());
  Json::Value down = Source(other_url);
  EXPECT_EQ("failing", down["state"].asString()) << down;
  EXPECT_EQ(last_good, down["last_success"].asInt64());
  EXPECT_FALSE(down["error"].asString().empty()) << down;
  EXPECT_EQ("Other feed", down["name"].asString());
  EXPECT_EQ("ok", Source(feed_.Url())["state"].asString());
}

TEST_F(CatalogueFreshnessTest, AFreshCacheAsksNoServerAndAForcedReloadAsksEvery) {
  ASSERT_TRUE(ListVendor(false).Success());
  ASSERT_TRUE(ListFeeds(false).Success());
  const int vendor_asked = server_.Requests("/vendor/catalogue.json");
  const int feed_asked = server_.Requests("/feed/catalogue.json");
  const int64_t attempt = Source(feed_.Url())["last_attempt"].asInt64();
  ASSERT_TRUE(ListVendor(false).Success());
  ASSERT_TRUE(ListFeeds(false).Success());
  EXPECT_EQ(vendor_asked, server_.Requests("/vendor/catalogue.json"));
  EXPECT_EQ(feed_asked, server_.Requests("/feed/catalogue.json"));
  EXPECT_EQ(attempt, Source(feed_.Url())["last_attempt"].asInt64());
  ASSERT_TRUE(ListVendor(true).Success());
  ASSERT_TRUE(ListFeeds(true).Success());
  EXPECT_EQ(vendor_asked + 1, server_.Requests("/vendor/catalogue.json"));
  EXPECT_EQ(feed_asked + 1, server_.Requests("/feed/catalogue.json"));
}

TEST_F(CatalogueFreshnessTest, AnEmptyFeedIsReportedWhenAddedAndListed) {
  HttpRoute empty;
  empty.body = R"({"packages": [], "recommend": []})";
  server_.Set("/empty/catalogue.json", empty);
  Json::Value item = FeedItem(server_.Url("/empty/catalogue.json"), "Empty");
  CgiAnswer added = client().Call(kFeedApi, "add", 1, {{"list", ListParam(item)}});
  ASSERT_TRUE(added.Success()) << added.body;
  EXPECT_EQ(0, added.Data()["packages"].asInt()) << added.body;
  ASSERT_TRUE(added.Data()["packages"].isIntegral()) << added.body;
  // The probe fetched it: the record says it answers and lists nothing.
  Json::Value s = Source(item["feed"].asString());
  EXPECT_EQ("ok", s["state"].asString()) << s;
  EXPECT_EQ(0, s["packages"].asInt()) << s;
  ASSERT_TRUE(s["packages"].isIntegral()) << s;

  // A feed that lists something says how many.
  CgiAnswer listed =
      client().Call(kFeedApi, "add", 1, {{"list", ListParam(FeedItem(vendor_.Url(), ""))}});
  ASSERT_TRUE(listed.Success()) << listed.body;
  EXPECT_EQ(1, listed.Data()["packages"].asInt()) << listed.body;

  // A deleted feed's record goes with it.
  Json::Value gone(Json::arrayValue);
  gone.append(item["feed"]);
  ASSERT_TRUE(client().Call(kFeedApi, "delete", 1, {{"list", ListParam(gone)}}).Success());
  KIVOPackageServer::SourceStatus status;
  ASSERT_TRUE(KIVOPackageServer::PMSReadSourceStatus(item["feed"].asString(), &status));
  EXPECT_FALSE(status.known);
}

TEST_F(CatalogueFreshnessTest, OnlyAdministratorsReadIt) {
  root_.AddAccount("user", "secret", {"users"});
  ApiClient user("user", "secret");
  ASSERT_TRUE(user.signed_in());
  EXPECT_EQ(105, user.Call(kSources, "list", 1).Code());
  EXPECT_EQ(103, client().Call(kSources, "refresh", 1).Code());
}

}  // namespace
