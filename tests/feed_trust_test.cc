// The keys a feed publishes vouching for its own packages, through the real
// host against a loopback feed at trust level 0: a package signed by the
// feed's key installs from that feed, the same file uploaded is an unknown
// signer's, and once the feed is deleted its packages no longer verify.

#include <dirent.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kInst[] = "KIVO.Core.Package.Installation";
constexpr char kTask[] = "@KIVOPKG_DOWNLOAD_feed-app";

class FeedTrustTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(0);
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf("http://127.0.0.1:1/none",
                                                       "catalogue_timeout=\"2\"\n"
                                                       "download_stall_timeout=\"2\"\n"));
    keys_.reset(new TestKeys(root_.Path("/publisher")));
    signer_ = keys_->Create("Community Publisher <community@test.invalid>");
    TestPackage app;
    app.id = "feed-app";
    app.daemon = false;
    file_ = feed_.Add(app);
    keys_->Sign(file_, signer_);
    ASSERT_TRUE(feed_.Index());
    feed_.catalogue()["keyrings"].append(keys_->Export(signer_));
    feed_.Publish();
  }
  void TearDown() override { StopInstalledPackages(); }
  CgiAnswer Call(const std::string& api, const std::string& method, const Params& params = {}) {
    return client().Call(api, method, 1, params);
  }
  CgiAnswer FeedCall(const std::string& method, const Json::Value& list) {
    return Call("KIVO.Core.Package.Feed", method, {{"list", ListParam(list)}});
  }
  CgiAnswer WaitFinished() { return WaitTaskFinished(client(), kTask); }
  // Scratch keyrings left in the root's tmp/.
  int ScratchHomes() { return CountEntries(root_.Path("/tmp"), "source-keys-"); }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed"), "/feed"};
  std::unique_ptr<TestKeys> keys_;
  std::string signer_, file_;
};

TEST_F(FeedTrustTest, FeedKeyVouchesOnlyForItsOwnDownloadsWhileTheFeedIsListed) {
  Json::Value feed(Json::objectValue);
  feed["feed"] = feed_.Url();
  CgiAnswer added = FeedCall("add", feed);
  ASSERT_TRUE(added.Success()) << added.body;
  EXPECT_TRUE(added.Data()["has_keyrings"].asBool()) << added.body;

  CgiAnswer list = Call("KIVO.Core.Package.Server", "list", {{"blloadothers", "true"}});
  ASSERT_TRUE(list.Success()) << list.body;
  ASSERT_NE(std::string::npos, list.body.find("\"feed-app\"")) << list.body;

  // From the feed: the feed's key vouches for it, and the task says so.
  CgiAnswer start =
      Call(kInst, "install", {{"name", "feed-app"}, {"is_kivo", "false"}, {"blqinst", "true"}});
  ASSERT_TRUE(start.Success()) << start.body;
  CgiAnswer done = WaitFinished();
  EXPECT_FALSE(done.Data().isMember("error")) << done.body;
  EXPECT_EQ(feed_.Url(), done.Data()["feed"].asString()) << done.body;
  const std::string note = done.Data()["signature"].asString();
  EXPECT_NE(std::string::npos, note.find(signer_)) << note;
  EXPECT_NE(std::string::npos, note.find("vouched for by " + feed_.Url())) << note;
  ASSERT_TRUE(PackageRegistry::IsInstalled("feed-app")) << done.body;
  ASSERT_EQ(0, Kivoctl({"uninstall", "feed-app"}));

  // The same file uploaded: no feed vouches for an upload.
  CgiAnswer up = client().Upload(kInst, "upload", 1, {}, file_);
  ASSERT_TRUE(up.Success()) << up.body;
  EXPECT_EQ(4533, up.Data()["codesign_error"].asInt()) << up.body;
  CgiAnswer by_path = Call(kInst, "install", {{"path", file_}});
  EXPECT_EQ(4533, by_path.Code()) << by_path.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("feed-app"));

  // Once the feed is deleted, a download of the very same link is refused.
  Json::Value gone(Json::arrayValue);
  gone.append(feed_.Url());
  ASSERT_TRUE(FeedCall("delete", gone).Success());
  const std::string link = feed_.Entry("feed-app")["link"].asString();
  start = Call(kInst, "install",
               {{"name", "feed-app"}, {"url", link}, {"filesize", "0"}, {"blqinst", "true"}});
  ASSERT_TRUE(start.Success()) << start.body;
  done = WaitFinished();
  EXPECT_EQ(PKG_ERR_UNKNOWN_SIGNER, done.Data()["error"]["result"].asInt()) << done.body;
  EXPECT_EQ("", done.Data()["feed"].asString()) << done.body;
  EXPECT_FALSE(PackageRegistry::IsInstalled("feed-app"));
  EXPECT_EQ(0, ScratchHomes());
}

}  // namespace
