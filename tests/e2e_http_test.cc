// The web API over HTTP through lighttpd, as a browser or script reaches it,
// once per way lighttpd runs it: entry.cgi per request (CGI) and kivo-webd's
// forked children (SCGI).

#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/reader.h>

#include "host/cgi_request.h"
#include "klibc/atomic_file.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"
#include "webapi/api_codes.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

struct HttpAnswer {
  std::string head;
  Json::Value json;
};

// Runs curl with `args` and returns the response headers and parsed body.
HttpAnswer Curl(const std::vector<std::string>& args) {
  std::vector<std::string> argv = {"/usr/bin/curl", "-s", "-i"};
  argv.insert(argv.end(), args.begin(), args.end());
  std::string raw;
  RunProgram(argv, &raw);
  HttpAnswer answer;
  size_t split = raw.find("\r\n\r\n");
  answer.head = raw.substr(0, split);
  std::string body = split == std::string::npos ? "" : raw.substr(split + 4);
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  reader->parse(body.data(), body.data() + body.size(), &answer.json, nullptr);
  return answer;
}

// A session signed in through lighttpd: its cookie jar and token.
struct HttpSession {
  HttpAnswer login;
  std::string jar;
  std::string token;
};

class EndToEndHttpTest : public testing::TestWithParam<WebMode> {
 protected:
  WebServerOptions Options() const {
    WebServerOptions options;
    options.mode = GetParam();
    return options;
  }
  // Signs the administrator in at `url`, keeping the cookie in a jar under `root`.
  static HttpSession SignIn(const TempRoot& root, const std::string& url) {
    HttpSession session;
    session.jar = root.Path("/cookies");
    session.login =
        Curl({"-c", session.jar, "--data",
              "api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=secret", url});
    session.token = session.login.json["data"]["token"].asString();
    return session;
  }
};

TEST_P(EndToEndHttpTest, SignInQueryAndReadALogThroughLighttpd) {
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  root.Write("/var/packages/demo/INFO", "package=\"demo\"\nlogfile=\"demo.log\"\n");
  root.Write("/var/packages/demo/var/demo.log", "hello from demo\n");
  WebServer server(root.dir(), Options());
  ASSERT_TRUE(server.running());
  const std::string url = server.EntryURL();
  HttpSession admin = SignIn(root, url);
  ASSERT_TRUE(admin.login.json["success"].asBool()) << admin.login.head;
  EXPECT_NE(std::string::npos, admin.login.head.find("application/json"));

  HttpAnswer info = Curl({url + "?api=KIVO.API.Info&version=1&method=query"});
  EXPECT_EQ(2, info.json["data"]["KIVO.Core.Package.Installation"]["maxVersion"].asInt());

  const std::string log_url = url + "?api=KIVO.Core.Package.Log&version=1&method=get&name=demo";
  HttpAnswer log = Curl({"-b", admin.jar, "-H", "X-KIVO-Token: " + admin.token, log_url});
  EXPECT_EQ("hello from demo\n", log.json["data"]["pkglog"].asString()) << log.head;

  EXPECT_EQ(kErrNotPermitted, Curl({"-b", admin.jar, log_url}).json["error"]["code"].asInt());
  EXPECT_EQ(kErrNotSignedIn, Curl({log_url}).json["error"]["code"].asInt());
  EXPECT_EQ(kErrBadRequest, Curl({url + "?api=%zz"}).json["error"]["code"].asInt());
}

TEST_P(EndToEndHttpTest, UploadInstallAndListThroughLighttpd) {
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  root.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
  TestPackage app;
  app.id = "http-app";
  app.files = {{"big.bin", std::string(3 << 20, 'q')}};  // several MiB through the stream
  std::string file = app.Build(root.Path("/tmp"));
  WebServer server(root.dir(), Options());
  ASSERT_TRUE(server.running());
  const std::string url = server.EntryURL();
  HttpSession admin = SignIn(root, url);
  const std::string header = "X-KIVO-Token: " + admin.token;

  HttpAnswer up = Curl({"-b", admin.jar, "-H", header, "-F", "file=@" + file,
                        url + "?api=KIVO.Core.Package.Installation&version=1&method=upload"});
  ASSERT_TRUE(up.json["success"].asBool()) << up.head;
  std::string task = up.json["data"]["task_id"].asString();
  HttpAnswer install =
      Curl({"-b", admin.jar, "-H", header, "--data",
            "api=KIVO.Core.Package.Installation&version=1&method=install&task_id=" + task, url});
  ASSERT_TRUE(install.json["success"].asBool()) << install.head;
  HttpAnswer list =
      Curl({"-b", admin.jar, "-H", header, url + "?api=KIVO.Core.Package&version=1&method=list"});
  EXPECT_EQ("http-app", list.json["data"]["packages"][0]["id"].asString());
  std::string big;
  ASSERT_TRUE(KIVOReadFile(root.Path("/var/packages/http-app/target/big.bin"), &big));
  EXPECT_EQ(3u << 20, big.size());
}

// Sends a POST of `length` bytes of `content_type` to the web API, all of it
// whether or not the server still reads, and returns the answer's status
// line.
std::string PostStatus(int port, const std::string& content_type, size_t length) {
  std::string request =
      "POST /webapi/entry.cgi HTTP/1.0\r\nHost: 127.0.0.1\r\nContent-Type: " + content_type +
      "\r\nContent-Length: " + std::to_string(length) + "\r\n\r\n" + std::string(length, 'a');
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  std::string answer;
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) {
    for (size_t at = 0; at < request.size();) {
      ssize_t n = send(fd, request.data() + at, request.size() - at, MSG_NOSIGNAL);
      if (n <= 0) break;  // refused early: the answer is waiting
      at += static_cast<size_t>(n);
    }
    char buf[4096];
    for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) answer.append(buf, n);
  }
  close(fd);
  return answer.substr(0, answer.find("\r\n"));
}

// lighttpd refuses a body over the host's own limits with 413, before any
// of it reaches the host, and lets one at the limit through to the host
// (which answers as for any request): the root's upload limit for multipart
// bodies (small here), 4 MiB for the others.
TEST_P(EndToEndHttpTest, LighttpdRefusesBodiesOverTheHostsLimits) {
  TempRoot root;
  const uint64_t upload_limit = 100 << 10;
  root.Write("/etc/kivo/webapi.conf",
             "max_upload_bytes=\"" + std::to_string(upload_limit) + "\"\n");
  WebServerOptions options = Options();
  options.max_upload_bytes = upload_limit;
  WebServer server(root.dir(), options);
  ASSERT_TRUE(server.running());
  const std::string multipart = "multipart/form-data; boundary=b";
  EXPECT_EQ("HTTP/1.0 200 OK", PostStatus(server.port(), multipart, upload_limit));
  EXPECT_EQ("HTTP/1.0 413 Payload Too Large",
            PostStatus(server.port(), multipart, upload_limit + 1));
  const std::string form = "application/x-www-form-urlencoded";
  EXPECT_EQ("HTTP/1.0 200 OK", PostStatus(server.port(), form, kMaxBodyBytes));
  EXPECT_EQ("HTTP/1.0 413 Payload Too Large", PostStatus(server.port(), form, kMaxBodyBytes + 1));
}

INSTANTIATE_TEST_SUITE_P(Modes, EndToEndHttpTest, testing::Values(WebMode::kCgi, WebMode::kScgi),
                         [](const testing::TestParamInfo<WebMode>& info) {
                           return std::string(WebModeName(info.param));
                         });

}  // namespace
