// A package that asks to run as root (INFO run_as_root="yes") is installed
// and upgraded only when a key of the appliance keyring signed it. Through
// the real host, kivoctl and the package tool, with packages built and
// signed by the project's tool and a loopback feed: a root package signed
// by the keyring's key uploads, says what it will be allowed to do, installs
// and upgrades; an unsigned one is refused at the upload, the install and on
// the command line at every trust level, the administrator's confirmation
// notwithstanding; one signed by a feed's key is refused from the feed, also
// as an upgrade of a package that came from that feed.

#include <memory>

#include <gtest/gtest.h>
#include <json/writer.h>

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
constexpr char kServer[] = "KIVO.Core.Package.Server";
constexpr int kErrRootNotTrusted = 4620;

bool Has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

class RootPackageTest : public AdminApiTest {
 protected:
  void SetUp() override {
    Trust(0);
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf("http://127.0.0.1:1/none",
                                                       "catalogue_timeout=\"5\"\n"
                                                       "download_stall_timeout=\"5\"\n"));
    keys_.reset(new TestKeys(root_.Path("/keys")));
    appliance_key_ = keys_->Create("Appliance Publisher <publisher@test.invalid>");
    keys_->Trust(appliance_key_);
    feed_key_ = keys_->Create("Feed Publisher <feed@test.invalid>");
  }
  void TearDown() override { StopInstalledPackages(); }

  static TestPackage Package(const std::string& id, const std::string& version, bool root) {
    TestPackage p;
    p.id = id;
    p.version = version;
    p.daemon = false;
    if (root) p.info["run_as_root"] = "yes";
    return p;
  }
  // A package file of its own, signed by `key` ("" for unsigned).
  std::string File(const TestPackage& p, const std::string& key) {
    std::string file = p.Build(root_.Path("/local"));
    if (!key.empty()) keys_->Sign(file, key);
    return file;
  }
  // The feed offers `p` signed by the feed's key, and publishes that key.
  void Offer(const TestPackage& p) {
    keys_->Sign(feed_.Replace(p), feed_key_);
    ASSERT_TRUE(feed_.Index());
    feed_.catalogue()["keyrings"].append(keys_->Export(feed_key_));
    feed_.Publish();
  }
  void AddFeed() {
    Json::Value feed(Json::objectValue);
    feed["feed"] = feed_.Url();
    CgiAnswer added = Call("KIVO.Core.Package.Feed", "add", {{"list", ListParam(feed)}});
    ASSERT_TRUE(added.Success()) << added.body;
  }
  CgiAnswer Call(const std::string& api, const std::string& method, const Params& params = {}) {
    return client().Call(api, method, 1, params);
  }
  // A quick install of `id` from the feed, as the page starts it; the
  // finished task's data.
  Json::Value InstallFromFeed(const std::string& id) {
    EXPECT_TRUE(
        Call(kServer, "list", {{"blforcereload", "true"}, {"blloadothers", "true"}}).Success());
    CgiAnswer start =
        Call(kInst, "install", {{"name", id}, {"is_kivo", "false"}, {"blqinst", "true"}});
    EXPECT_TRUE(start.Success()) << start.body;
    CgiAnswer s = WaitTaskFinished(client(), "@KIVOPKG_DOWNLOAD_" + id, 400);
    EXPECT_TRUE(s.Data()["finished"].asBool()) << s.body;
    return s.Data();
  }
  std::string Version(const std::string& id) {
    KeyValueMap info;
    return PackageRegistry::ReadInfo(id, &info) ? info["version"] : "";
  }

  HttpTestServer server_;
  CatalogueFeed feed_{server_, root_.Path("/feed-files"), "/feed"};
  std::unique_ptr<TestKeys> keys_;
  std::string appliance_key_, feed_key_;
};

TEST_F(RootPackageTest, RootPackageSignedByTheKeyringInstallsAndUpgrades) {
  TestPackage p = Package("root-app", "1.0", true);
  p.info["memory_limit_mb"] = "256";
  CgiAnswer up = client().Upload(kInst, "upload", 1, {}, File(p, appliance_key_));
  ASSERT_TRUE(up.Success()) << up.body;
  const Json::Value& permissions = up.Data()["permissions"];
  EXPECT_TRUE(permissions["run_as_root"].asBool()) << up.body;
  EXPECT_EQ("256", permissions["memory_limit_mb"].asString()) << up.body;
  EXPECT_FALSE(permissions.isMember("process_limit")) << up.body;
  EXPECT_TRUE(Has(permissions["signature"].asString(),
                  appliance_key_ + ", vouched for by appliance keyring"))
      << up.body;

  CgiAnswer done = Call(kInst, "install", {{"task_id", up.Data()["task_id"].asString()}});
  ASSERT_TRUE(done.Success()) << done.body;
  EXPECT_EQ("1.0", Version("root-app"));

  std::string out;
  EXPECT_EQ(0, Kivoctl({"install", File(Package("root-app", "2.0", true), appliance_key_)}, &out))
      << out;
  EXPECT_EQ("2.0", Version("root-app"));
}

TEST_F(RootPackageTest, UnsignedRootPackageIsRefusedWhateverTheTrustLevelAndConfirmation) {
  const std::string root_file = File(Package("root-app", "1.0", true), "");
  const std::string plain_file = File(Package("plain-app", "1.0", false), "");
  for (int level : {1, 2}) {
    SCOPED_TRACE("trust level " + std::to_string(level));
    Trust(level);
    CgiAnswer up = client().Upload(kInst, "upload", 1, {}, root_file);
    EXPECT_EQ(kErrRootNotTrusted, up.Code()) << up.body;
    EXPECT_TRUE(Has(up.Errors()["message"].asString(), "root-app asks to run as root")) << up.body;
    EXPECT_TRUE(Has(up.Errors()["message"].asString(), "it is not signed")) << up.body;

    CgiAnswer by_path = Call(kInst, "install", {{"path", root_file}, {"check_codesign", "false"}});
    EXPECT_EQ(kErrRootNotTrusted, by_path.Code()) << by_path.body;

    std::string out;
    EXPECT_EQ(1, Kivoctl({"install", root_file, "--no-codesign"}, &out)) << out;
    EXPECT_TRUE(Has(out, "[320]")) << out;
    EXPECT_FALSE(PackageRegistry::IsInstalled("root-app"));
  }
  // The same confirmation installs an unsigned package that runs as its own user.
  std::string out;
  EXPECT_EQ(0, Kivoctl({"install", plain_file, "--no-codesign"}, &out)) << out;
}

TEST_F(RootPackageTest, RootPackageSignedByAFeedKeyIsRefusedFromTheFeed) {
  Trust(2);
  Offer(Package("root-app", "1.0", true));
  // The catalogue says what the package asks for before anything is downloaded.
  EXPECT_EQ("yes", feed_.Entry("root-app")["run_as_root"].asString());
  AddFeed();

  Json::Value data = InstallFromFeed("root-app");
  EXPECT_EQ(PKG_ERR_ROOT_NOT_TRUSTED, data["error"]["result"].asInt()) << data;
  EXPECT_TRUE(Has(data["error"]["message"].asString(), "vouched for by " + feed_.Url() + " only"))
      << data;
  EXPECT_FALSE(PackageRegistry::IsInstalled("root-app"));
}

TEST_F(RootPackageTest, AnUpgradeThatAsksForRootNeedsTheKeyringKey) {
  Offer(Package("feed-app", "1.0", false));
  AddFeed();
  Json::Value first = InstallFromFeed("feed-app");
  ASSERT_FALSE(first.isMember("error")) << first;
  ASSERT_EQ("1.0", Version("feed-app"));

  // The feed's key vouches for the feed's packages, not for root.
  Offer(Package("feed-app", "2.0", true));
  std::string out;
  EXPECT_EQ(1, Kivoctl({"install-server", "feed-app", "--feed", feed_.Url()}, &out)) << out;
  EXPECT_TRUE(Has(out, "[320]")) << out;
  EXPECT_EQ("1.0", Version("feed-app"));
}

}  // namespace
