// The per-user settings that the desktop's applications write through the
// host: each account writes only its own document, members merge into the
// application's object, and the package center's information reads back the
// terms-of-service agreement stored this way.

#include <chrono>
#include <ctime>
#include <thread>

#include <gtest/gtest.h>

#include "klibc/json_text.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/temp_root.h"
#include "webapi/api_codes.h"

namespace {

constexpr char kApp[] = "KIVO.PXS.PkgManApp.Instance";

class UserSettingsTest : public AdminApiTest {
 protected:
  void SetUp() override { root_.AddAccount("guest", "guest-pw", {"users"}); }

  Json::Value Document(const std::string& user) const {
    Json::Value doc;
    return KIVOParseJson(FileText(root_.Path("/usr/kivo/etc/users/" + user + "/settings.json")),
                         &doc)
               ? doc
               : Json::Value();
  }

  static CgiAnswer Set(const ApiClient& client, const std::string& app,
                       const std::string& settings) {
    return client.Call("KIVO.API.UserSettings", "set", 1, {{"app", app}, {"settings", settings}});
  }
};

TEST_F(UserSettingsTest, MembersMergeIntoTheCallersOwnApplicationObject) {
  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());
  root_.Write("/usr/kivo/etc/users/admin/settings.json",
              std::string(R"({"other":{"x":1},")") + kApp + R"(":{"tos_hash":"h1","keep":true}})");

  CgiAnswer a = Set(admin, kApp, R"({"termofservice":true,"agreed_tos_hash":"h1"})");
  ASSERT_TRUE(a.Success()) << a.body;
  Json::Value doc = Document("admin");
  EXPECT_EQ(1, doc["other"]["x"].asInt());
  EXPECT_TRUE(doc[kApp]["keep"].asBool());
  EXPECT_EQ("h1", doc[kApp]["tos_hash"].asString());
  EXPECT_TRUE(doc[kApp]["termofservice"].asBool());
  EXPECT_EQ("h1", doc[kApp]["agreed_tos_hash"].asString());

  // An account that is not an administrator keeps settings too, its own.
  ApiClient guest("guest", "guest-pw");
  ASSERT_TRUE(guest.signed_in());
  ASSERT_TRUE(Set(guest, "Notes", R"({"font":"large"})").Success());
  EXPECT_EQ("large", Document("guest")["Notes"]["font"].asString());
  EXPECT_FALSE(Document("admin").isMember("Notes"));
}

TEST_F(UserSettingsTest, BadParametersAndMissingProofAreRefusedAndWriteNothing) {
  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());
  EXPECT_EQ(kErrParameter, Set(admin, "../../etc", R"({"a":1})").Code());
  EXPECT_EQ(kErrParameter, Set(admin, "", R"({"a":1})").Code());
  EXPECT_EQ(kErrParameter, Set(admin, kApp, R"([1,2])").Code());
  EXPECT_EQ(kErrParameter, Set(admin, kApp, "not json").Code());
  CgiAnswer big = Set(admin, kApp, R"({"a":")" + std::string(70 * 1024, 'x') + R"("})");
  EXPECT_EQ(kErrParameter, big.Code()) << big.body;
  EXPECT_TRUE(Document("admin").isNull());

  // A cookie without the token is what a forged cross-site request carries.
  CgiAnswer forged = RunEntryCgi(
      {{"REQUEST_METHOD", "GET"},
       {"QUERY_STRING", "api=KIVO.API.UserSettings&version=1&method=set&app=A&settings={}"},
       {"HTTP_COOKIE", "id=" + admin.sid()}});
  EXPECT_EQ(kErrNotPermitted, forged.Code()) << forged.body;
  CgiAnswer anonymous = RunEntryCgi(
      {{"REQUEST_METHOD", "GET"},
       {"QUERY_STRING", "api=KIVO.API.UserSettings&version=1&method=set&app=A&settings={}"}});
  EXPECT_EQ(kErrNotSignedIn, anonymous.Code());
  EXPECT_TRUE(Document("admin").isNull());
}

// The agreement a page stores here is what the package center's information
// reads: agreeing to the current terms stops them being shown.
TEST_F(UserSettingsTest, AnAgreementStoredHereEndsTheTermsPrompt) {
  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());
  // A fresh cached hash, so the information asks no server.
  root_.Write("/usr/kivo/etc/users/admin/settings.json",
              std::string(R"({")") + kApp + R"(":{"tos_hash":"h1","tos_hash_timestamp":)" +
                  std::to_string(time(nullptr)) + "}}");
  auto show_tos = [&] {
    return admin.Call("KIVO.Core.Package.Info", "get", 1).Data()["show_tos"].asString();
  };
  EXPECT_EQ("new", show_tos());
  ASSERT_TRUE(
      Set(admin, kApp, R"({"termofservice":true,"termofservice_4_2":true,"agreed_tos_hash":"h1"})")
          .Success());
  EXPECT_EQ("no", show_tos());
  ASSERT_TRUE(Set(admin, kApp, R"({"agreed_tos_hash":"h0"})").Success());
  EXPECT_EQ("change", show_tos());
}

// The information fetches the terms' hash from a slow server and then
// caches it in the same document; an agreement stored meanwhile (another tab)
// must survive that write.
TEST_F(UserSettingsTest, AnAgreementStoredWhileTheHashIsFetchedIsKept) {
  HttpTestServer vendor;
  HttpRoute info;
  info.body = R"({"content_hash":"h2"})";
  info.delay_ms = 1500;
  vendor.Set("/company-info.json", info);
  root_.Write("/etc/kivo/pkgserver.conf",
              "company_info_url=\"" + vendor.Url("/company-info.json") + "\"\n");
  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());

  CgiAnswer asked;
  std::thread tab([&] { asked = admin.Call("KIVO.Core.Package.Info", "get", 1); });
  while (vendor.Requests("/company-info.json") == 0)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  ASSERT_TRUE(Set(admin, kApp, R"({"termofservice":true,"agreed_tos_hash":"h2"})").Success());
  tab.join();

  ASSERT_TRUE(asked.Success()) << asked.body;
  Json::Value app = Document("admin")[kApp];
  EXPECT_EQ("h2", app["tos_hash"].asString());
  EXPECT_EQ("h2", app["agreed_tos_hash"].asString());
  EXPECT_TRUE(app["termofservice"].asBool());
}

}  // namespace
