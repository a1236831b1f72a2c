// A changing request runs to its end when its client hangs up half way: a
// browser reloaded right after "Uninstall" or "Install" must not leave the
// operation cut short, in either way lighttpd runs the web API.

#include <chrono>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "testing/cgi_client.h"
#include "testing/http_test_server.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

// The body of an HTTP answer, parsed; null when it is not JSON.
Json::Value AnswerBody(const std::string& response) {
  size_t split = response.find("\r\n\r\n");
  Json::Value value;
  if (split == std::string::npos || !KIVOParseJson(response.substr(split + 4), &value)) return {};
  return value;
}

// A signed-in administrator's cookie and token header lines.
std::string SignIn(int port) {
  const std::string form = "api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=secret";
  Json::Value login = AnswerBody(
      LoopbackExchange(port,
                       "POST /webapi/entry.cgi HTTP/1.0\r\nHost: 127.0.0.1\r\n"
                       "Content-Type: application/x-www-form-urlencoded\r\nContent-Length: " +
                           std::to_string(form.size()) + "\r\n\r\n" + form));
  return "Cookie: id=" + login["data"]["sid"].asString() +
         "\r\nX-KIVO-Token: " + login["data"]["token"].asString() + "\r\n";
}

// Sends a whole `request` and hangs up `patience` later, before the
// answer comes, as a browser does when its page is reloaded.
void PostAndHangUp(int port, const std::string& request, std::chrono::milliseconds patience) {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  ASSERT_GE(fd, 0);
  sockaddr_in addr = {};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(0, connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)));
  ASSERT_EQ(static_cast<ssize_t>(request.size()), send(fd, request.data(), request.size(), 0));
  std::this_thread::sleep_for(patience);
  close(fd);
}

// True once `done` holds, checked every 50 ms for up to 30 s.
template <typename Done>
bool Eventually(Done done) {
  for (int i = 0; i < 600; ++i) {
    if (done()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  return done();
}

// The text of an HTTP POST to the web API with `query`, signed in with
// `auth`, of `content_type` and `body`.
std::string Post(const std::string& auth, const std::string& query, const std::string& content_type,
                 const std::string& body) {
  return "POST /webapi/entry.cgi" + query + " HTTP/1.0\r\nHost: 127.0.0.1\r\n" + auth +
         "Content-Type: " + content_type + "\r\nContent-Length: " + std::to_string(body.size()) +
         "\r\n\r\n" + body;
}

bool Exists(const TempRoot& root, const std::string& path) {
  return access(root.Path(path).c_str(), F_OK) == 0;
}

class AbandonedRequestTest : public testing::TestWithParam<WebMode> {};

TEST_P(AbandonedRequestTest, EveryChangingRequestFinishesAfterItsClientHangsUp) {
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  root.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");  // unsigned test packages
  // Each step holds its request well past the client's patience.
  TestPackage slow;
  slow.id = "slow-app";
  slow.scripts["preuninst"] = "sleep 1\n";
  slow.scripts["start-stop-status"] =
      "case \"$1\" in\n  start) sleep 1; touch \"$KIVO_PKG_VAR/up\" ;;\n"
      "  stop) sleep 1; rm -f \"$KIVO_PKG_VAR/up\" ;;\n  status) [ -f \"$KIVO_PKG_VAR/up\" ] "
      ";;\nesac\n";
  slow.daemon = false;
  std::string out;
  ASSERT_EQ(0, Kivoctl({"install", slow.Build(root.Path("/tmp"))}, &out)) << out;
  TestPackage uploaded;
  uploaded.id = "uploaded-app";
  uploaded.scripts["postinst"] = "sleep 1\n";
  TestPackage fetched;
  fetched.id = "fetched-app";
  fetched.scripts["postinst"] = "sleep 1\n";
  std::string fetched_file;
  ASSERT_TRUE(KIVOReadFile(fetched.Build(root.Path("/tmp")), &fetched_file));
  HttpTestServer feed;
  HttpRoute route;
  route.body = fetched_file;
  feed.Set("/fetched-app.kpk", route);

  WebServerOptions options;
  options.mode = GetParam();
  WebServer server(root.dir(), options);
  ASSERT_TRUE(server.running());
  const int port = server.port();
  const std::string auth = SignIn(port);
  const std::string form = "application/x-www-form-urlencoded";
  const auto patience = std::chrono::milliseconds(300);
  const std::string api = "api=KIVO.Core.Package";

  PostAndHangUp(port, Post(auth, "", form, api + ".Control&version=1&method=start&id=slow-app"),
                patience);
  EXPECT_TRUE(Eventually([&] { return Exists(root, "/var/packages/slow-app/enabled"); }))
      << "the start stopped when its client hung up";
  PostAndHangUp(port, Post(auth, "", form, api + ".Control&version=1&method=stop&id=slow-app"),
                patience);
  EXPECT_TRUE(Eventually([&] { return !Exists(root, "/var/packages/slow-app/enabled"); }))
      << "the stop stopped when its client hung up";
  PostAndHangUp(
      port, Post(auth, "", form, api + ".Uninstallation&version=1&method=uninstall&id=slow-app"),
      patience);
  EXPECT_TRUE(Eventually([&] { return !Exists(root, "/var/packages/slow-app/INFO"); }))
      << "the uninstall stopped when its client hung up";

  std::string file, type;
  ASSERT_TRUE(KIVOReadFile(uploaded.Build(root.Path("/tmp")), &file));
  std::string multipart = MultipartBody({}, "uploaded-app.kpk", file, &type);
  Json::Value up = AnswerBody(LoopbackExchange(
      port, Post(auth, "?" + api + ".Installation&version=1&method=upload", type, multipart)));
  ASSERT_TRUE(up["success"].asBool()) << up.toStyledString();
  PostAndHangUp(port,
                Post(auth, "", form,
                     api + ".Installation&version=1&method=install&task_id=" +
                         up["data"]["task_id"].asString()),
                patience);
  EXPECT_TRUE(Eventually([&] { return Exists(root, "/var/packages/uploaded-app/INFO"); }))
      << "the upload's install stopped when its client hung up";

  PostAndHangUp(port,
                Post(auth, "", form,
                     api +
                         ".Installation&version=1&method=install&name=fetched-app&filesize=0"
                         "&blqinst=true&url=" +
                         feed.Url("/fetched-app.kpk")),
                std::chrono::milliseconds(20));
  EXPECT_TRUE(Eventually([&] { return Exists(root, "/var/packages/fetched-app/INFO"); }))
      << "the catalogue's install stopped when its client hung up";
}

INSTANTIATE_TEST_SUITE_P(BothModes, AbandonedRequestTest,
                         testing::Values(WebMode::kCgi, WebMode::kScgi),
                         [](const testing::TestParamInfo<WebMode>& info) {
                           return std::string(WebModeName(info.param));
                         });

}  // namespace
