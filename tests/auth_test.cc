// Signing in through the real host: the back-off after failed sign-ins, the
// equal cost of unknown accounts, the per-account session limit and the rule
// that a password only travels in a POST body.

#include <algorithm>
#include <chrono>
#include <dirent.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

#include "host/host_api.h"
#include "klibc/key_value_file.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/temp_root.h"

namespace {

class AuthTest : public AdminApiTest {
 protected:
  void SetUp() override { root_.AddAccount("ops", "ops-pw", {"administrators"}); }

  void Configure(const std::string& settings) { root_.Write("/etc/kivo/webapi.conf", settings); }

  // Signs in by POST from `address` (the web server's REMOTE_ADDR).
  static CgiAnswer SignIn(const std::string& account, const std::string& password,
                          const std::string& address = "192.0.2.10") {
    std::string body = EncodeForm({{"api", "KIVO.API.Auth"},
                                   {"version", "1"},
                                   {"method", "login"},
                                   {"account", account},
                                   {"passwd", password}});
    return RunEntryCgi({{"REQUEST_METHOD", "POST"},
                        {"REMOTE_ADDR", address},
                        {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                        {"CONTENT_LENGTH", std::to_string(body.size())}},
                       body);
  }

  // True when the session `sid` still opens a package API.
  static bool SessionWorks(const std::string& sid) {
    CgiAnswer a = RunEntryCgi(
        {{"REQUEST_METHOD", "GET"},
         {"QUERY_STRING", "api=KIVO.Core.Package.Log&version=1&method=get&name=x&_sid=" + sid}});
    EXPECT_TRUE(a.Success() || a.Code() == kErrNotSignedIn) << a.body;
    return a.Success();
  }

  // The users of the session files in the root's sessions folder.
  std::vector<std::string> SessionUsers() const {
    std::vector<std::string> users;
    std::string dir = root_.Path("/run/kivo/sessions");
    DIR* d = opendir(dir.c_str());
    while (struct dirent* e = d ? readdir(d) : nullptr) {
      KeyValueMap fields;
      if (e->d_name[0] != '.' && KIVOKeyValueLoad(dir + "/" + e->d_name, &fields))
        users.push_back(fields["user"]);
    }
    if (d) closedir(d);
    return users;
  }
};

// Refused for a while; `retry_after` is somewhat less than the whole wait
// when the machine is slow to run the attempts.
void ExpectThrottled(const CgiAnswer& a, long min_retry_after, long max_retry_after) {
  EXPECT_EQ(kErrSignInThrottled, a.Code()) << a.body;
  EXPECT_LE(min_retry_after, a.Errors()["retry_after"].asInt64()) << a.body;
  EXPECT_GE(max_retry_after, a.Errors()["retry_after"].asInt64()) << a.body;
  EXPECT_FALSE(a.Errors()["reason"].asString().empty()) << a.body;
}

void WaitSeconds(double seconds) {
  std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
}

TEST_F(AuthTest, FailedSignInsHoldBackTheirAddressUntilTheBackOffPasses) {
  Configure("login_free_failures=\"3\"\nlogin_backoff_base=\"2\"\nlogin_backoff_max=\"60\"\n");
  const std::string first = "192.0.2.66", second = "192.0.2.67";
  for (const std::string& address : {first, second}) {
    for (int i = 0; i < 3; ++i)
      EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", address).Code());
    // The right password is refused too while the back-off lasts, and
    // waiting attempts do not lengthen it.
    ExpectThrottled(SignIn("admin", "secret", address), 1, 2);
    ExpectThrottled(SignIn("ops", "ops-pw", address), 1, 2);
  }
  WaitSeconds(2.2);
  // Once the wait is over the right password is taken; another failure
  // instead doubles the wait.
  EXPECT_TRUE(SignIn("admin", "secret", first).Success());
  EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", second).Code());
  ExpectThrottled(SignIn("admin", "secret", second), 3, 4);

  // A success forgets the failures: the free ones are free again.
  for (int i = 0; i < 3; ++i) EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", first).Code());
  ExpectThrottled(SignIn("admin", "secret", first), 1, 2);
}

TEST_F(AuthTest, ASuccessOnASharedAddressDoesNotLengthenTheNextPersonsWait) {
  Configure("login_free_failures=\"1\"\nlogin_backoff_base=\"1\"\nlogin_backoff_max=\"60\"\n");
  const std::string office = "192.0.2.80";
  // Someone at the office mistypes ops's password twice: the second try
  // already waits, and after it the office waits 2 seconds.
  EXPECT_EQ(kErrWrongPassword, SignIn("ops", "typo", office).Code());
  WaitSeconds(1.2);
  EXPECT_EQ(kErrWrongPassword, SignIn("ops", "typo", office).Code());
  ExpectThrottled(SignIn("admin", "secret", office), 1, 2);
  WaitSeconds(2.2);
  // Once that wait is over, one colleague after another signs in rightly:
  // none of them is made to wait by the one before.
  for (int i = 0; i < 3; ++i) {
    CgiAnswer a = SignIn("admin", "secret", office);
    EXPECT_TRUE(a.Success()) << i << ": " << a.body;
  }
}

TEST_F(AuthTest, AddressesAreCountedApartAndGuessesSpreadOverManyHoldBackTheAccount) {
  Configure("login_free_failures=\"3\"\nlogin_backoff_base=\"60\"\n");
  const std::string attacker = "192.0.2.66";
  for (int i = 0; i < 3; ++i)
    EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", attacker).Code());
  ExpectThrottled(SignIn("admin", "secret", attacker), 50, 60);
  // One address cannot lock the account: its owner elsewhere signs in, and
  // that does not free the guessing address.
  EXPECT_TRUE(SignIn("admin", "secret", "198.51.100.7").Success());
  ExpectThrottled(SignIn("admin", "secret", attacker), 50, 60);

  // Every address of one IPv6 /64 is one address; an IPv4-mapped one is the
  // IPv4 address.
  EXPECT_EQ(kErrWrongPassword, SignIn("nobody", "x", "2001:db8:1:2::1").Code());
  EXPECT_EQ(kErrWrongPassword, SignIn("nobody", "x", "2001:db8:1:2::2").Code());
  EXPECT_EQ(kErrWrongPassword, SignIn("nobody", "x", "2001:db8:1:2:ffff::3").Code());
  ExpectThrottled(SignIn("ops", "ops-pw", "2001:db8:1:2::4"), 50, 60);
  EXPECT_TRUE(SignIn("ops", "ops-pw", "2001:db8:1:3::1").Success());
  for (int i = 0; i < 3; ++i)
    EXPECT_EQ(kErrWrongPassword, SignIn("ops", "x", "203.0.113.5").Code());
  ExpectThrottled(SignIn("ops", "ops-pw", "::ffff:203.0.113.5"), 50, 60);

  // Three more addresses guessing admin's password, one try each: admin is
  // now held back from a fourth address too, ops is not.
  for (const char* address : {"203.0.113.21", "203.0.113.22", "203.0.113.23"})
    EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", address).Code());
  ExpectThrottled(SignIn("admin", "secret", "203.0.113.24"), 50, 60);
  EXPECT_TRUE(SignIn("ops", "ops-pw", "203.0.113.24").Success());
}

TEST_F(AuthTest, RacingGuessesAreCountedBeforeTheirPasswordIsChecked) {
  Configure("login_free_failures=\"3\"\nlogin_backoff_base=\"60\"\n");
  std::vector<int> codes(12);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < codes.size(); ++i)
    threads.emplace_back([&codes, i] { codes[i] = SignIn("admin", "guess").Code(); });
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(3, std::count(codes.begin(), codes.end(), kErrWrongPassword));
  EXPECT_EQ(9, std::count(codes.begin(), codes.end(), kErrSignInThrottled));
}

TEST_F(AuthTest, ADamagedAttemptsFileIsStartedAfresh) {
  Configure("login_free_failures=\"1\"\nlogin_backoff_base=\"60\"\n");
  const std::string file = "/run/kivo/login-throttle.json";
  for (const std::string& damage :
       {std::string("{\"addresses\""), std::string("[1, 2]"),
        std::string("{\"addresses\": {\"192.0.2.10\": \"x\", \"192.0.2.11\": {\"last\": "
                    "\"soon\", \"failures\": {\"admin\": 9223372036854775807, \"ops\": "
                    "\"many\"}}}, \"accounts\": {\"admin\": []}}")}) {
    root_.Write(file, damage);
    EXPECT_TRUE(SignIn("admin", "secret").Success()) << damage;
    EXPECT_EQ(kErrWrongPassword, SignIn("admin", "guess", "192.0.2.11").Code()) << damage;
    ExpectThrottled(SignIn("admin", "secret", "192.0.2.11"), 50, 60);
  }
}

// The median wall time of `sign_in`, in seconds.
template <typename Fn>
double MedianSeconds(Fn sign_in, std::vector<double>* samples) {
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(kErrWrongPassword, sign_in().Code());
  samples->push_back(
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
  std::vector<double> sorted = *samples;
  std::sort(sorted.begin(), sorted.end());
  return sorted[sorted.size() / 2];
}

TEST_F(AuthTest, UnknownAccountsCostAsMuchAsAWrongPassword) {
  Configure("login_free_failures=\"1000\"\n");
  std::vector<double> known, unknown, invalid;
  double known_median = 0, unknown_median = 0, invalid_median = 0;
  // Interleaved, so that whatever else the machine does weighs on each alike.
  for (int i = 0; i < 5; ++i) {
    known_median = MedianSeconds([] { return SignIn("admin", "wrong"); }, &known);
    unknown_median = MedianSeconds([] { return SignIn("nobody", "wrong"); }, &unknown);
    invalid_median = MedianSeconds([] { return SignIn("No Such Name!", "wrong"); }, &invalid);
  }
  EXPECT_LT(known_median / unknown_median, 2.0) << known_median << " vs " << unknown_median;
  EXPECT_LT(unknown_median / known_median, 2.0) << known_median << " vs " << unknown_median;
  EXPECT_LT(known_median / invalid_median, 2.0) << known_median << " vs " << invalid_median;
}

TEST_F(AuthTest, SignInsBeyondTheLimitEndTheAccountsOldestSessions) {
  Configure("session_max_per_account=\"3\"\n");
  std::string ops_sid = SignIn("ops", "ops-pw").Data()["sid"].asString();
  std::vector<std::string> sids;
  for (int i = 0; i < 5; ++i) {
    CgiAnswer a = SignIn("admin", "secret");
    ASSERT_TRUE(a.Success()) << a.body;
    sids.push_back(a.Data()["sid"].asString());
  }
  std::vector<std::string> users = SessionUsers();
  EXPECT_EQ(3, std::count(users.begin(), users.end(), "admin"));
  EXPECT_FALSE(SessionWorks(sids[0]));
  EXPECT_FALSE(SessionWorks(sids[1]));
  for (int i = 2; i < 5; ++i) EXPECT_TRUE(SessionWorks(sids[i])) << i;
  // Another account's session is not the admin's to end.
  EXPECT_TRUE(SessionWorks(ops_sid));
}

TEST_F(AuthTest, PasswordsAreTakenOnlyFromAPostBody) {
  const std::string login = "api=KIVO.API.Auth&version=1&method=login";
  CgiAnswer get = RunEntryCgi(
      {{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", login + "&account=admin&passwd=secret"}});
  EXPECT_EQ(kErrBadRequest, get.Code()) << get.body;
  EXPECT_NE(std::string::npos, get.Errors()["reason"].asString().find("POST")) << get.body;

  // A POST whose query string carries the password or the account.
  const struct {
    std::string query, body;
  } posts[] = {{login + "&account=admin&passwd=secret", ""},
               {"passwd=secret", login + "&account=admin"},
               {"account=admin", login + "&passwd=secret"}};
  for (const auto& p : posts) {
    CgiAnswer post = RunEntryCgi({{"REQUEST_METHOD", "POST"},
                                  {"QUERY_STRING", p.query},
                                  {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                                  {"CONTENT_LENGTH", std::to_string(p.body.size())}},
                                 p.body);
    EXPECT_EQ(kErrBadRequest, post.Code()) << p.query << ": " << post.body;
  }
  EXPECT_TRUE(SessionUsers().empty());
  EXPECT_TRUE(SignIn("admin", "secret").Success());
}

// A reloaded page gets its account and token back from the cookie alone; a
// session id passed as a parameter is not enough, and logging out ends it.
TEST_F(AuthTest, TheCookieSessionTellsAReloadedPageItsTokenAndRole) {
  root_.AddAccount("viewer", "view-pw", {"users"});
  const std::string query = "api=KIVO.API.Auth&version=1&method=session";
  auto ask = [&](const std::string& cookie, const std::string& extra = "") {
    return RunEntryCgi(
        {{"REQUEST_METHOD", "GET"}, {"QUERY_STRING", query + extra}, {"HTTP_COOKIE", cookie}});
  };
  EXPECT_EQ(kErrNotSignedIn, ask("").Code());
  EXPECT_EQ(kErrNotSignedIn, ask("id=0123456789abcdef0123456789abcdef").Code());

  CgiAnswer admin = SignIn("admin", "secret");
  ASSERT_TRUE(admin.Success()) << admin.body;
  const std::string sid = admin.Data()["sid"].asString();
  CgiAnswer a = ask("lang=en; id=" + sid);
  ASSERT_TRUE(a.Success()) << a.body;
  EXPECT_EQ("admin", a.Data()["account"].asString());
  EXPECT_EQ(admin.Data()["token"], a.Data()["token"]);
  EXPECT_TRUE(a.Data()["administrator"].asBool());
  EXPECT_EQ(kErrNotSignedIn, ask("", "&_sid=" + sid).Code());

  CgiAnswer viewer = SignIn("viewer", "view-pw");
  ASSERT_TRUE(viewer.Success()) << viewer.body;
  CgiAnswer v = ask("id=" + viewer.Data()["sid"].asString());
  ASSERT_TRUE(v.Success()) << v.body;
  EXPECT_FALSE(v.Data()["administrator"].asBool());

  CgiAnswer out = RunEntryCgi({{"REQUEST_METHOD", "GET"},
                               {"QUERY_STRING", "api=KIVO.API.Auth&version=1&method=logout"},
                               {"HTTP_COOKIE", "id=" + sid},
                               {"HTTP_X_KIVO_TOKEN", a.Data()["token"].asString()}});
  ASSERT_TRUE(out.Success()) << out.body;
  EXPECT_EQ(kErrNotSignedIn, ask("id=" + sid).Code());
}

}  // namespace
