// A feed whose catalogue nests a hundred thousand arrays deep: every reader
// of it treats it as any malformed catalogue. Automatic updates report that
// source as failed and still apply what the vendor offers; the catalogue
// list, the update check and adding the feed answer instead of ending their
// process.

#include <gtest/gtest.h>
#include <json/value.h>

#include "pkgtool/registry.h"
#include "testing/admin_api_test.h"
#include "testing/catalogue_feed.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kServer[] = "KIVO.Core.Package.Server";

class NestedCatalogueTest : public AdminApiTest {
 protected:
  void SetUp() override {
    root_.Write("/etc/kivo/pkgserver.conf", VendorConf(vendor_.Url(), "catalogue_timeout=\"2\"\n"));
    root_.Write("/etc/kivoinfo.conf",
                "pkg_source_trust_level=\"1\"\nenable_pkg_autoupdate_all=\"yes\"\n"
                "pkg_autoupdate_all=\"yes\"\npackage_update_channel=\"stable\"\n");
    // A package installed from the vendor, which now offers 2.0.
    TestPackage v1, v2;
    v1.id = v2.id = "nest-app";
    v1.daemon = v2.daemon = false;
    v2.version = "2.0";
    ASSERT_TRUE(vendor_.Offer(v1));
    std::string out;
    ASSERT_EQ(0, Kivoctl({"install-server", "nest-app"}, &out)) << out;
    vendor_.Replace(v2);
    ASSERT_TRUE(vendor_.Index());
    vendor_.Publish();
    // The hostile feed, already in the list (adding it is refused, below).
    HttpRoute deep;
    deep.body = std::string(100000, '[') + std::string(100000, ']');
    server_.Set("/deep/catalogue.json", deep);
    root_.Write("/usr/kivo/etc/packages/feeds",
                "[{\"feed\": \"" + Deep() + "\", \"name\": \"deep\"}]");
  }
  std::string Deep() const { return server_.Url("/deep/catalogue.json"); }

  HttpTestServer server_;
  CatalogueFeed vendor_{server_, root_.Path("/vendor-files"), "/vendor"};
};

TEST_F(NestedCatalogueTest, AutoUpdateReportsTheFeedAndAppliesTheVendorsUpgrade) {
  std::string out;
  EXPECT_EQ(1, Kivoctl({"auto-update"}, &out)) << out;
  EXPECT_NE(std::string::npos, out.find("the catalogue of the feed " + Deep() + " cannot be read"))
      << out;
  EXPECT_NE(std::string::npos, out.find("nest-app: upgraded 1.0 -> 2.0")) << out;
  KeyValueMap info;
  ASSERT_TRUE(PackageRegistry::ReadInfo("nest-app", &info));
  EXPECT_EQ("2.0", info["version"]);
}

TEST_F(NestedCatalogueTest, TheWebApiAnswersAsForAnyMalformedCatalogue) {
  // The feeds' list has no readable catalogue and says so; the vendor's
  // list is unharmed.
  CgiAnswer feeds = client().Call(kServer, "list", 1, {{"blloadothers", "true"}});
  EXPECT_EQ(100, feeds.Code()) << feeds.body;
  CgiAnswer list = client().Call(kServer, "list", 1);
  ASSERT_TRUE(list.Success()) << list.body;
  bool vendor_listed = false;
  for (const Json::Value& e : list.Data()["data"]) vendor_listed |= e["id"] == "nest-app";
  EXPECT_TRUE(vendor_listed) << list.body;

  // The update check counts what the readable sources offer.
  CgiAnswer check = client().Call(kServer, "check", 1);
  EXPECT_TRUE(check.Success()) << check.body;

  // Adding another feed that answers so is refused as no package server.
  HttpRoute deep;
  deep.body = std::string(100000, '[') + std::string(100000, ']');
  server_.Set("/deeper/catalogue.json", deep);
  Json::Value again;
  again["feed"] = server_.Url("/deeper/catalogue.json");
  again["name"] = "again";
  CgiAnswer add = client().Call("KIVO.Core.Package.Feed", "add", 1, {{"list", ListParam(again)}});
  EXPECT_EQ(4590, add.Code()) << add.body;
}

}  // namespace
