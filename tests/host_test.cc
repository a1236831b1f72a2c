// The web API host end to end as the web server runs it: entry.cgi with a
// CGI environment on a temporary system root.

#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "testing/cgi_client.h"
#include "testing/temp_root.h"
#include "webapi/api_table.h"

namespace {

class HostTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    root_.AddAccount("guest", "guest-pw", {"users"});
  }

  static CgiAnswer Get(const std::string& query, CgiEnv env = {}) {
    env["REQUEST_METHOD"] = "GET";
    env["QUERY_STRING"] = query;
    return RunEntryCgi(env);
  }

  static CgiAnswer Post(const std::string& body, CgiEnv env = {}) {
    env["REQUEST_METHOD"] = "POST";
    env.emplace("CONTENT_TYPE", "application/x-www-form-urlencoded");
    env.emplace("CONTENT_LENGTH", std::to_string(body.size()));
    return RunEntryCgi(env, body);
  }

  TempRoot root_;
};

constexpr char kLogGet[] = "api=KIVO.Core.Package.Log&version=1&method=get&name=nope";

TEST_F(HostTest, LoginGivesSessionCookieAndToken) {
  CgiAnswer a = Post("api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=secret");
  ASSERT_TRUE(a.Success()) << a.body;
  std::string sid = a.Data()["sid"].asString();
  EXPECT_EQ(32u, sid.size());
  EXPECT_EQ(32u, a.Data()["token"].asString().size());
  EXPECT_NE(std::string::npos,
            a.head.find("Set-Cookie: id=" + sid + "; Path=/; HttpOnly; SameSite=Strict"));
  EXPECT_NE(std::string::npos, a.head.find("Content-Type: application/json; charset=utf-8"));

  CgiAnswer wrong = Post("api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=nope");
  EXPECT_EQ(400, wrong.Code());
  CgiAnswer unknown = Post("api=KIVO.API.Auth&version=1&method=login&account=nobody&passwd=x");
  EXPECT_EQ(400, unknown.Code());
  CgiAnswer missing = Post("api=KIVO.API.Auth&version=1&method=login&account=admin");
  EXPECT_EQ(120, missing.Code());
  EXPECT_EQ("passwd", missing.Errors()["name"].asString());
}

TEST_F(HostTest, InfoQueryListsEveryAPIWithItsVersions) {
  CgiAnswer a = Get("api=KIVO.API.Info&version=1&method=query");
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ(1, a.Data()["KIVO.Core.Package.Installation"]["minVersion"].asInt());
  EXPECT_EQ(2, a.Data()["KIVO.Core.Package.Installation"]["maxVersion"].asInt());
  EXPECT_TRUE(a.Data().isMember("KIVO.Package"));
  EXPECT_TRUE(a.Data().isMember("KIVO.API.Auth"));
  EXPECT_EQ("entry.cgi", a.Data()["KIVO.Core.Package.Log"]["path"].asString());
}

TEST_F(HostTest, RoutingErrors) {
  ApiClient admin("admin", "secret");
  EXPECT_EQ(101, Get("api=KIVO.Core.Package.Log&method=get").Code());
  EXPECT_EQ(101, Get("api=KIVO.Core.Package.Log&method=get&version=x1").Code());
  EXPECT_EQ(101, Get("").Code());
  EXPECT_EQ(102, admin.Call("KIVO.Core.Nothing", "get", 1).Code());
  EXPECT_EQ(103, admin.Call("KIVO.Core.Package.Log", "put", 1).Code());
  EXPECT_EQ(104, admin.Call("KIVO.Core.Package.Log", "get", 3).Code());
  EXPECT_EQ(103, admin.Call("KIVO.API.Info", "nothing", 1).Code());
  EXPECT_EQ(104, admin.Call("KIVO.API.Info", "query", 2).Code());
}

TEST_F(HostTest, MalformedRequestsGetAClearAnswer) {
  struct Case {
    CgiEnv env;
    std::string body;
  } cases[] = {
      {{{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", "api=KIVO.API.Info&version=1&method=que%zzry"}},
       ""},
      {{{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", "api=%"}}, ""},
      {{{"REQUEST_METHOD", "DELETE"}, {"QUERY_STRING", "api=KIVO.API.Info&version=1&method=query"}},
       ""},
      {{{"REQUEST_METHOD", "POST"},
        {"CONTENT_LENGTH", "100"},
        {"CONTENT_TYPE", "application/x-www-form-urlencoded"}},
       "api=KIVO.API.Info&version=1"},
      {{{"REQUEST_METHOD", "POST"}, {"CONTENT_LENGTH", "-5"}}, ""},
      {{{"REQUEST_METHOD", "POST"},
        {"CONTENT_LENGTH", "99999999999"},
        {"CONTENT_TYPE", "application/x-www-form-urlencoded"}},
       ""},
      {{{"REQUEST_METHOD", "POST"}, {"CONTENT_LENGTH", "3"}, {"CONTENT_TYPE", "text/xml"}}, "<a>"},
      {{{"REQUEST_METHOD", "POST"},
        {"CONTENT_LENGTH", "3"},
        {"CONTENT_TYPE", "multipart/form-data; boundary=x"}},
       "abc"},
  };
  for (const Case& c : cases) {
    CgiAnswer a = RunEntryCgi(c.env, c.body);
    EXPECT_EQ(0, a.exit_status);
    EXPECT_EQ(101, a.Code()) << a.body;
    EXPECT_FALSE(a.Errors()["reason"].asString().empty()) << a.body;
  }
  std::string many;
  for (int i = 0; i < 1500; ++i) many += "p" + std::to_string(i) + "=1&";
  EXPECT_EQ(101, Get(many + "api=KIVO.API.Info&version=1&method=query").Code());
}

TEST_F(HostTest, HostileValuesNeverBreakTheAnswer) {
  ApiClient admin("admin", "secret");
  // Non-UTF-8 bytes, invalid JSON, a very long value and deep nesting all
  // reach the checker and handler as plain values; the answer stays JSON.
  for (const std::string& name : {std::string("\xFF\xFE\x80pkg"), std::string("[\"a\""),
                                  std::string(1 << 20, 'x'), std::string(5000, '[')}) {
    CgiAnswer a = admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", name}});
    EXPECT_EQ(0, a.exit_status);
    ASSERT_TRUE(a.Success()) << a.body.substr(0, 200);
    EXPECT_EQ("", a.Data()["pkglog"].asString());
  }
  // Nesting deeper than the decoder takes is kept as text, like any non-JSON.
  std::string deep = std::string(5000, '[') + std::string(5000, ']');
  CgiAnswer arr = admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", deep}});
  EXPECT_EQ(0, arr.exit_status);
  EXPECT_TRUE(arr.Success()) << arr.body.substr(0, 200);
}

TEST_F(HostTest, PackageAPIsNeedASignedInAdministrator) {
  EXPECT_EQ(119, Get(kLogGet).Code());
  EXPECT_EQ(119, Get(kLogGet, {{"HTTP_COOKIE", "id=0123456789abcdef0123456789abcdef"}}).Code());
  EXPECT_EQ(119, Get(kLogGet, {{"HTTP_COOKIE", "id=../../etc/passwd"}}).Code());
  EXPECT_EQ(119, Get(std::string(kLogGet) + "&_sid=forged").Code());

  ApiClient guest("guest", "guest-pw");
  ASSERT_TRUE(guest.signed_in());
  EXPECT_EQ(105, guest.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Code());

  ApiClient admin("admin", "secret");
  ASSERT_TRUE(admin.signed_in());
  EXPECT_TRUE(admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Success());
  // Scripts carry the session in _sid and need no token.
  EXPECT_TRUE(Get(std::string(kLogGet) + "&_sid=" + admin.sid()).Success());
}

TEST_F(HostTest, CookieSessionsNeedTheirTokenExceptForPagesLoadedByURL) {
  ApiClient admin("admin", "secret");
  std::string cookie = "lang=en; id=" + admin.sid();
  EXPECT_EQ(105, Get(kLogGet, {{"HTTP_COOKIE", cookie}}).Code());
  EXPECT_EQ(105, Get(kLogGet, {{"HTTP_COOKIE", cookie}, {"HTTP_X_KIVO_TOKEN", "wrong"}}).Code());
  EXPECT_TRUE(
      Get(kLogGet, {{"HTTP_COOKIE", cookie}, {"HTTP_X_KIVO_TOKEN", admin.token()}}).Success());
  // The inline-frame page passes authorization without the token and reaches
  // its handler (which answers for itself).
  CgiAnswer frame =
      Get("api=KIVO.Core.Package.FakeIFrame&version=1&method=get", {{"HTTP_COOKIE", cookie}});
  EXPECT_NE(105, frame.Code());
  EXPECT_NE(119, frame.Code());
}

TEST_F(HostTest, ExpiredAndLoggedOutSessions) {
  ApiClient admin("admin", "secret");
  std::string file = root_.Path("/run/kivo/sessions/" + admin.sid());
  struct stat st;
  ASSERT_EQ(0, stat(file.c_str(), &st)) << "sessions live in the root's run folder";
  struct timespec old[2] = {{time(nullptr) - 3600, 0}, {time(nullptr) - 3600, 0}};
  ASSERT_EQ(0, utimensat(AT_FDCWD, file.c_str(), old, 0));
  EXPECT_EQ(106, admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Code());
  EXPECT_EQ(119, admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Code());

  ApiClient again("admin", "secret");
  EXPECT_TRUE(again.Call("KIVO.API.Auth", "logout", 1).Success());
  EXPECT_EQ(119, again.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Code());
}

TEST_F(HostTest, SessionLimitsComeFromTheConfiguration) {
  root_.Write("/etc/kivo/webapi.conf", "session_idle_timeout=\"1800\"\nsession_max_age=\"1\"\n");
  ApiClient admin("admin", "secret");
  sleep(2);
  EXPECT_EQ(106, admin.Call("KIVO.Core.Package.Log", "get", 1, {{"name", "x"}}).Code());
}

// How the host copes with a module that breaks the frame's rules.
class HostFrameTest : public HostTest {
 protected:
  void SetUp() override {
    HostTest::SetUp();
    setenv("KIVO_MODULE_DIR", (BuildDir() + "/lib/kivo/test-modules").c_str(), 1);
  }
  void TearDown() override { unsetenv("KIVO_MODULE_DIR"); }
  CgiAnswer Call(const std::string& method) {
    return RunEntryCgi(
        {{"REQUEST_METHOD", "GET"},
         {"KIVO_MODULE_DIR", getenv("KIVO_MODULE_DIR")},
         {"QUERY_STRING", "api=Test.Frame&version=1&method=" + method + "&_sid=" + sid_}});
  }
  void SignIn() { sid_ = ApiClient("admin", "secret").sid(); }
  std::string sid_;
};

TEST_F(HostFrameTest, DefaultAnswersAndForkedChildren) {
  SignIn();
  EXPECT_EQ(100, Call("silent").Code());
  EXPECT_EQ(100, Call("throws").Code());
  CgiAnswer forked = Call("fork");
  EXPECT_EQ("parent", forked.Data()["who"].asString()) << forked.body;
  EXPECT_EQ(std::string::npos, forked.body.find("child"));
  CgiAnswer raw = Call("raw");
  EXPECT_EQ("Content-Type: text/plain", raw.head);
  EXPECT_EQ("raw body", raw.body);
  CgiAnswer refused = Call("refused");
  EXPECT_EQ(120, refused.Code());
  EXPECT_EQ("refused", refused.Errors().asString());
}

TEST(ModuleTablesTest, LayoutOrderAndTerminators) {
  void* module = dlopen((BuildDir() + "/lib/kivo/modules/KIVO.Core.Package.so").c_str(), RTLD_NOW);
  ASSERT_NE(nullptr, module) << dlerror();
  auto table = reinterpret_cast<GetAPITableFn>(dlsym(module, "GetAPITable"))();
  auto checks = reinterpret_cast<GetAPICheckTableFn>(dlsym(module, "GetAPICheckTable"))();
  int rows = 0;
  while (table[rows].api) ++rows;
  ASSERT_EQ(38, rows);
  EXPECT_EQ(nullptr, table[rows].method);
  EXPECT_EQ(0, table[rows].version);
  EXPECT_EQ(nullptr, table[rows].handler);
  EXPECT_STREQ("list", table[0].method);
  EXPECT_STREQ("KIVO.Package", table[37].api);
  EXPECT_EQ(table[0].handler, table[37].handler);
  EXPECT_EQ(2, table[4].version);
  EXPECT_EQ(table[3].handler, table[4].handler);
  EXPECT_STREQ("delete", table[16].method);

  int check_rows = 0;
  for (; checks[check_rows].api; ++check_rows) {
    EXPECT_STRNE("KIVO.Package", checks[check_rows].api);
    EXPECT_EQ(nullptr, checks[check_rows].reserved1);
    EXPECT_EQ(nullptr, checks[check_rows].reserved2);
    EXPECT_NE(nullptr, checks[check_rows].checker);
  }
  EXPECT_EQ(37, check_rows);
  EXPECT_EQ(nullptr, checks[check_rows].checker);
  // Every dispatch row but the legacy one has its checker row.
  for (int i = 0; i < 37; ++i) {
    bool found = false;
    for (int j = 0; j < check_rows; ++j) {
      found |= strcmp(table[i].api, checks[j].api) == 0 &&
               strcmp(table[i].method, checks[j].method) == 0 &&
               table[i].version == checks[j].version;
    }
    EXPECT_TRUE(found) << table[i].api << " " << table[i].method;
  }
}

}  // namespace
