// The inline-frame page through the real host on a temporary root: the page
// byte for byte for an administrator, a bare 404 for everyone else.

#include <gtest/gtest.h>

#include "testing/cgi_client.h"
#include "testing/temp_root.h"

namespace {

const char kQuery[] = "api=KIVO.Core.Package.FakeIFrame&version=1&method=get";

const char kPage[] =
    "<html style='background-color:transparent;overflow:hidden;margin:0;height:100%;width:100%;"
    "border-width:0;'>\n"
    "<head>\n"
    "<meta http-equiv=\"Content-Type\" content=\"text/html; charset=utf-8\">\n"
    "<meta http-equiv='X-UA-Compatible' content='IE=9' />\n"
    "</head>\n"
    "<body style='background-color:transparent;overflow:hidden;margin:0;height:100%;width:100%;"
    "border-width:0;'>\n"
    "<script type='text/javascript'>document.blready=true;</script>\n"
    "</body></html>\n";

class FakeIFrameTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    root_.AddAccount("alice", "wonder", {"users"});
  }

  // Loads the page as a browser does: by URL, with whatever cookie it holds
  // and no token header.
  static CgiAnswer LoadByURL(const std::string& cookie, const std::string& extra_query = "") {
    CgiEnv env = {{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", kQuery + extra_query}};
    if (!cookie.empty()) env["HTTP_COOKIE"] = cookie;
    return RunEntryCgi(env);
  }

  static void ExpectPage(const CgiAnswer& a) {
    EXPECT_EQ(0, a.exit_status);
    EXPECT_EQ("Content-Type: text/html; charset=\"UTF-8\"", a.head);
    EXPECT_EQ(kPage, a.body);
  }

  static void ExpectBare404(const CgiAnswer& a) {
    EXPECT_EQ(0, a.exit_status);
    EXPECT_EQ("Cache-control: no-store\r\nStatus: 404 Not Found", a.head);
    EXPECT_EQ("", a.body);
  }

  TempRoot root_;
};

TEST_F(FakeIFrameTest, AdministratorGetsThePageByCookieSidOrCall) {
  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());
  ExpectPage(LoadByURL("id=" + admin.sid()));
  ExpectPage(LoadByURL("", "&_sid=" + admin.sid()));
  ExpectPage(admin.Call("KIVO.Core.Package.FakeIFrame", "get", 1));
}

TEST_F(FakeIFrameTest, EveryoneElseGetsABare404) {
  ApiClient alice("alice", "wonder");
  ASSERT_TRUE(alice.signed_in());
  ExpectBare404(alice.Call("KIVO.Core.Package.FakeIFrame", "get", 1));
  ExpectBare404(LoadByURL("id=" + alice.sid()));
  ExpectBare404(LoadByURL(""));
  ExpectBare404(LoadByURL("id=0123456789abcdef0123456789abcdef"));

  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.Call("KIVO.API.Auth", "logout", 1).Success());
  ExpectBare404(LoadByURL("id=" + admin.sid()));
}

TEST_F(FakeIFrameTest, OtherPackageMethodsStillRefuseInJson) {
  // Only the inline frame guards itself; the rest keep the host's refusals.
  CgiAnswer anonymous = RunEntryCgi(
      {{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", "api=KIVO.Core.Package&version=1&method=list"}});
  EXPECT_EQ(119, anonymous.Code()) << anonymous.body;
  ApiClient alice("alice", "wonder");
  CgiAnswer member = alice.Call("KIVO.Core.Package", "list", 1);
  EXPECT_EQ(105, member.Code()) << member.body;
}

}  // namespace
