// Each installed package keeps the origin it came from (the vendor's
// server, a feed, a file) and the key that signed it. Through the real
// host, kivoctl and the package tool, on loopback package servers at trust
// level 0: a feed whose own key signs a newer version of a package that
// came from a trusted publisher's file cannot take it over, neither by
// automatic update nor by hand; an administrator may switch the origin
// explicitly; upgrades from the same origin and signer still work; and the
// catalogue and the update badge offer a package's upgrades only from its
// own origin.

#include <memory>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "webapi/webapi_util.h"

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";
constexpr char kServer[] = "KIVO.Core.Package.Server";
// What a version's postupgrade leaves in the package's data folder: proof
// that the version's scripts ran.
constexpr char kPostupgrade[] = "echo \"$KIVO_PKG_VERSION\" > \"$KIVO_PKG_VAR/postupgrade-ran\"\n";

bool Has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

class PackageOriginTest : public AdminApiTest {
 protected:
  void SetUp() override {
    TrustLevel(0);
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor_.Url(),
                                                       "catalogue_timeout=\"5\"\n"
                                                       "download_stall_timeout=\"5\"\n"));
    keys_.reset(new TestKeys(root_.Path("/keys")));
    publisher_ = keys_->Create("Trusted Publisher <publisher@test.invalid>");
    keys_->Trust(publisher_);
    feed_key_ = keys_->Create("Feed Publisher <feed@test.invalid>");
    other_feed_key_ = keys_->Create("Second Feed Publisher <second@test.invalid>");
    ASSERT_TRUE(vendor_.Index());
    vendor_.Publish();
  }
  void TearDown() override { StopInstalledPackages(); }

  // Trust level `level`, automatic updates on for every package.
  void TrustLevel(int level) {
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"" + std::to_string(level) +
                                          "\"\nenable_pkg_autoupdate_all=\"yes\"\n"
                                          "pkg_autoupdate_all=\"yes\"\n"
                                          "package_update_channel=\"stable\"\n");
  }
  static TestPackage Package(const std::string& id, const std::string& version) {
    TestPackage p;
    p.id = id;
    p.version = version;
    p.daemon = false;
    p.scripts = {{"postupgrade", kPostupgrade}};
    return p;
  }
  // A package file of its own, signed by `key` ("" for unsigned).
  std::string File(const std::string& id, const std::string& version, const std::string& key) {
    std::string file = Package(id, version).Build(root_.Path("/local"));
    if (!key.empty()) keys_->Sign(file, key);
    return file;
  }
  // `server` offers `id` at `version`, signed by `key`, in place of any
  // version it offered before; the feed publishes both feed keys.
  void Offer(CatalogueFeed& server, const std::string& id, const std::string& version,
             const std::string& key) {
    std::string file = server.Replace(Package(id, version));
    if (!key.empty()) keys_->Sign(file, key);
    ASSERT_TRUE(server.Index());
    if (&server == &feed_) {
      for (const std::string& fpr : {feed_key_, other_feed_key_}) {
        server.catalogue()["keyrings"].append(keys_->Export(fpr));
      }
    }
    server.Publish();
  }
  void AddFeed() {
    Json::Value feed(Json::objectValue);
    feed["feed"] = feed_.Url();
    CgiAnswer added = Call("KIVO.Core.Package.Feed", "add", {{"list", ListParam(feed)}});
    ASSERT_TRUE(added.Success()) << added.body;
    ASSERT_TRUE(added.Data()["has_keyrings"].asBool()) << added.body;
  }
  // demo-legacy 0.9 installed by hand from a file of the appliance's own
  // publisher, and then the feed, offering 99.0, added.
  void LegacyFromAFileThenTheFeedOffersMore() {
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install", File("demo-legacy", "0.9", publisher_)}, &out)) << out;
    Offer(feed_, "demo-legacy", "99.0", feed_key_);
    AddFeed();
  }
  CgiAnswer Call(const std::string& api, const std::string& method, const Params& params = {}) {
    return client().Call(api, method, 1, params);
  }
  // A quick install of `id` from the feeds through the web API, as the
  // page starts it after a refresh of the catalogue; the finished task's
  // data.
  Json::Value InstallFromFeed(const std::string& id, const Params& extra = {}) {
    EXPECT_TRUE(
        Call(kServer, "list", {{"blforcereload", "true"}, {"blloadothers", "true"}}).Success());
    Params params = {{"name", id}, {"is_kivo", "false"}, {"blqinst", "true"}};
    params.insert(params.end(), extra.begin(), extra.end());
    CgiAnswer start = Call(kInst, "install", params);
    EXPECT_TRUE(start.Success()) << start.body;
    CgiAnswer s = WaitTaskFinished(client(), "@KIVOPKG_DOWNLOAD_" + id, 400);
    EXPECT_TRUE(s.Data()["finished"].asBool()) << s.body;
    return s.Data();
  }
  std::string Version(const std::string& id) {
    KeyValueMap info;
    return PackageRegistry::ReadInfo(id, &info) ? info["version"] : "";
  }
  // The version whose postupgrade ran last, "" when none ran.
  std::string PostupgradeRan(const std::string& id) {
    std::string text;
    if (!KIVOReadFile(root_.Path("/volume1/@appdata/" + id + "/postupgrade-ran"), &text)) return "";
    return text.substr(0, text.find('\n'));
  }
  int AutoUpdate(std::string* out) { return Kivoctl({"auto-update"}, out); }

  HttpTestServer server_;
  CatalogueFeed vendor_{server_, root_.Path("/vendor-files"), "/vendor"};
  CatalogueFeed feed_{server_, root_.Path("/feed-files"), "/feed"};
  std::unique_ptr<TestKeys> keys_;
  std::string publisher_, feed_key_, other_feed_key_;
};

TEST_F(PackageOriginTest, AutoUpdateDoesNotLetAFeedTakeOverAPackageFromAFile) {
  LegacyFromAFileThenTheFeedOffersMore();
  std::string out;

  ASSERT_EQ(0, Kivoctl({"auto-update", "--dry-run"}, &out)) << out;
  EXPECT_FALSE(Has(out, "would upgrade")) << out;
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_TRUE(Has(out, "demo-legacy: skipped: 99.0 is offered by the feed " + feed_.Url() +
                           ", but demo-legacy was installed from a file"))
      << out;
  EXPECT_FALSE(Has(out, "upgraded")) << out;
  EXPECT_EQ("0.9", Version("demo-legacy"));
  EXPECT_EQ("", PostupgradeRan("demo-legacy"));
}

TEST_F(PackageOriginTest, AnUpgradeByHandFromAnotherOriginIsRefused) {
  LegacyFromAFileThenTheFeedOffersMore();
  std::string out;

  // From the feed, through the web API and through kivoctl.
  Json::Value task = InstallFromFeed("demo-legacy");
  EXPECT_EQ(PKG_ERR_OTHER_ORIGIN, task["error"]["result"].asInt()) << task.toStyledString();
  EXPECT_TRUE(Has(
      task["error"]["message"].asString(),
      "demo-legacy was installed from a file, and this version comes from the feed " + feed_.Url()))
      << task.toStyledString();
  EXPECT_EQ(1, Kivoctl({"install-server", "demo-legacy", "--feed", feed_.Url()}, &out)) << out;
  EXPECT_TRUE(Has(out, "[306]")) << out;
  EXPECT_EQ("0.9", Version("demo-legacy"));
  EXPECT_EQ("", PostupgradeRan("demo-legacy"));

  // The other way round: a package from the feed is not replaced by a file,
  // even one the appliance's own publisher signed.
  Offer(feed_, "feed-app", "1.0", feed_key_);
  ASSERT_EQ(0, Kivoctl({"install-server", "feed-app", "--feed", feed_.Url()}, &out)) << out;
  const std::string file = File("feed-app", "2.0", publisher_);
  CgiAnswer up = client().Upload(kInst, "upload", 1, {}, file);
  ASSERT_TRUE(up.Success()) << up.body;
  CgiAnswer install = Call(kInst, "install", {{"task_id", up.Data()["task_id"].asString()}});
  EXPECT_EQ(4543, install.Code()) << install.body;
  EXPECT_TRUE(Has(install.Errors()["message"].asString(),
                  "feed-app was installed from the feed " + feed_.Url()))
      << install.body;
  EXPECT_EQ(1, Kivoctl({"install", file}, &out)) << out;
  EXPECT_TRUE(Has(out, "[306]")) << out;
  EXPECT_EQ("1.0", Version("feed-app"));
}

TEST_F(PackageOriginTest, AnAdministratorMaySwitchThePackagesOriginExplicitly) {
  LegacyFromAFileThenTheFeedOffersMore();
  std::string out;
  EXPECT_EQ(PKG_ERR_OTHER_ORIGIN, InstallFromFeed("demo-legacy")["error"]["result"].asInt());

  Json::Value task = InstallFromFeed("demo-legacy", {{"switch_origin", "true"}});
  EXPECT_FALSE(task.isMember("error")) << task.toStyledString();
  EXPECT_EQ("the feed " + feed_.Url(), task["origin"].asString()) << task.toStyledString();
  EXPECT_EQ("99.0", Version("demo-legacy"));
  EXPECT_EQ("99.0", PostupgradeRan("demo-legacy"));

  // From now on it follows the feed, and a file is the other origin.
  Offer(feed_, "demo-legacy", "99.1", feed_key_);
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_TRUE(Has(out, "demo-legacy: upgraded 99.0 -> 99.1")) << out;
  const std::string file = File("demo-legacy", "99.2", publisher_);
  EXPECT_EQ(1, Kivoctl({"install", file}, &out)) << out;
  EXPECT_EQ("99.1", Version("demo-legacy"));
  ASSERT_EQ(0, Kivoctl({"install", file, "--switch-origin"}, &out)) << out;
  EXPECT_EQ("99.2", Version("demo-legacy"));
}

TEST_F(PackageOriginTest, UpgradesFromTheSameOriginAndSignerStillWork) {
  std::string out;
  Offer(vendor_, "vendor-app", "1.0", publisher_);
  Offer(feed_, "feed-app", "1.0", feed_key_);
  AddFeed();
  ASSERT_EQ(0, Kivoctl({"install-server", "vendor-app"}, &out)) << out;
  ASSERT_EQ(0, Kivoctl({"install-server", "feed-app", "--feed", feed_.Url()}, &out)) << out;
  ASSERT_EQ(0, Kivoctl({"install", File("file-app", "1.0", publisher_)}, &out)) << out;

  Offer(vendor_, "vendor-app", "2.0", publisher_);
  Offer(feed_, "feed-app", "2.0", feed_key_);
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_TRUE(Has(out, "vendor-app: upgraded 1.0 -> 2.0")) << out;
  EXPECT_TRUE(Has(out, "feed-app: upgraded 1.0 -> 2.0")) << out;
  EXPECT_EQ("2.0", PostupgradeRan("feed-app"));
  ASSERT_EQ(0, Kivoctl({"install", File("file-app", "2.0", publisher_)}, &out)) << out;
  EXPECT_EQ("2.0", Version("file-app"));

  // The same feed, but another of its keys: the feed's keys vouch for its
  // packages, not for a new signer of a package it already gave.
  Offer(feed_, "feed-app", "3.0", other_feed_key_);
  Json::Value task = InstallFromFeed("feed-app");
  EXPECT_EQ(PKG_ERR_OTHER_ORIGIN, task["error"]["result"].asInt()) << task.toStyledString();
  EXPECT_TRUE(Has(task["error"]["message"].asString(), "feed-app was signed by key " + feed_key_))
      << task.toStyledString();
  EXPECT_EQ("2.0", Version("feed-app"));
}

TEST_F(PackageOriginTest, TheCatalogueAndTheBadgeOfferUpgradesOnlyFromTheOrigin) {
  std::string out;
  Offer(vendor_, "vendor-app", "1.0", publisher_);
  ASSERT_EQ(0, Kivoctl({"install-server", "vendor-app"}, &out)) << out;
  ASSERT_EQ(0, Kivoctl({"install", File("demo-legacy", "0.9", publisher_)}, &out)) << out;
  Offer(vendor_, "vendor-app", "2.0", publisher_);
  Offer(vendor_, "demo-legacy", "1.0", publisher_);
  Offer(feed_, "demo-legacy", "99.0", feed_key_);
  Offer(feed_, "vendor-app", "5.0", feed_key_);
  AddFeed();

  CgiAnswer vendor = Call(kServer, "list", {{"blforcereload", "true"}});
  ASSERT_TRUE(vendor.Success()) << vendor.body;
  EXPECT_TRUE(CatalogueEntry(vendor, "vendor-app")["blupgrade"].asBool()) << vendor.body;
  EXPECT_FALSE(CatalogueEntry(vendor, "demo-legacy")["blupgrade"].asBool()) << vendor.body;
  EXPECT_EQ("a file", CatalogueEntry(vendor, "demo-legacy")["other_origin"].asString())
      << vendor.body;

  CgiAnswer feeds = Call(kServer, "list", {{"blforcereload", "true"}, {"blloadothers", "true"}});
  ASSERT_TRUE(feeds.Success()) << feeds.body;
  EXPECT_FALSE(feeds.Data()["blupgrade"].asBool()) << feeds.body;
  EXPECT_FALSE(CatalogueEntry(feeds, "demo-legacy")["blupgrade"].asBool()) << feeds.body;
  EXPECT_EQ("a file", CatalogueEntry(feeds, "demo-legacy")["other_origin"].asString())
      << feeds.body;
  EXPECT_FALSE(CatalogueEntry(feeds, "vendor-app")["blupgrade"].asBool()) << feeds.body;
  EXPECT_EQ("the vendor's server", CatalogueEntry(feeds, "vendor-app")["other_origin"].asString());

  ASSERT_TRUE(Call(kServer, "check").Success());
  std::string text;
  Json::Value badge;
  ASSERT_TRUE(KIVOReadFile(root_.Path("/var/cache/kivo/pkgserver/upgrade_badge.json"), &text));
  ASSERT_TRUE(WebAPIUtil::ParseJson(text, badge)) << text;
  EXPECT_EQ(1u, badge["count"].asUInt()) << text;
  EXPECT_EQ("vendor-app", badge["packages"][0].asString()) << text;
}

TEST_F(PackageOriginTest, ARecordWithoutAnOriginIsReadAsAFileOfAnUnknownSigner) {
  std::string out;
  Offer(vendor_, "old-app", "1.0", publisher_);
  ASSERT_EQ(0, Kivoctl({"install-server", "old-app"}, &out)) << out;
  // A record as the package tool wrote it before it recorded origins.
  ASSERT_EQ(0, unlink(root_.Path("/var/packages/old-app/ORIGIN").c_str()));
  Offer(vendor_, "old-app", "2.0", publisher_);
  ASSERT_EQ(0, AutoUpdate(&out)) << out;
  EXPECT_TRUE(Has(out,
                  "old-app: skipped: 2.0 is offered by the vendor's server, but old-app was "
                  "installed from a file"))
      << out;
  EXPECT_EQ("1.0", Version("old-app"));

  // A file signed by no known key does not replace it; one a key of the
  // appliance keyring signed does.
  TrustLevel(2);
  EXPECT_EQ(1, Kivoctl({"install", File("old-app", "1.5", feed_key_)}, &out)) << out;
  EXPECT_TRUE(Has(out, "[306]")) << out;
  ASSERT_EQ(0, Kivoctl({"install", File("old-app", "1.6", publisher_)}, &out)) << out;
  EXPECT_EQ("1.6", Version("old-app"));
}

}  // namespace
