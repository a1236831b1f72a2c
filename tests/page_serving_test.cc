// How lighttpd, configured by `kivoctl web-config`, serves the package
// center page beside the web API: compressed where the browser accepts it,
// with the headers caches need to keep the forms apart.

#include <gtest/gtest.h>

#include "testing/temp_root.h"
#include "testing/web_server.h"

namespace {

// The header block of an HTTP answer, lower-cased, and its body.
struct Answer {
  std::string head;
  std::string body;
};

Answer Get(int port, const std::string& target, const std::string& headers) {
  std::string raw = LoopbackExchange(
      port, "GET " + target + " HTTP/1.0\r\nHost: 127.0.0.1\r\n" + headers + "\r\n");
  size_t split = raw.find("\r\n\r\n");
  Answer answer;
  answer.head = raw.substr(0, split);
  for (char& c : answer.head) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  if (split != std::string::npos) answer.body = raw.substr(split + 4);
  return answer;
}

bool Has(const Answer& answer, const std::string& header_line) {
  return answer.head.find("\r\n" + header_line + "\r\n") != std::string::npos;
}

TEST(PageServingTest, ThePageGoesCompressedToBrowsersThatAcceptItAndTheApiDoesNot) {
  TempRoot root;
  std::string script;
  for (int i = 0; i < 2000; ++i) script += "export const line" + std::to_string(i) + " = 'text';\n";
  root.Write("/usr/kivo/www/assets/index-abc123.js", script);
  root.Write("/usr/kivo/www/index.html", "<!doctype html><title>Packages</title>" + script);
  for (WebMode mode : {WebMode::kCgi, WebMode::kScgi}) {
    SCOPED_TRACE(WebModeName(mode));
    WebServerOptions options;
    options.mode = mode;
    WebServer server(root.dir(), options);
    ASSERT_TRUE(server.running());

    Answer gzipped = Get(server.port(), "/assets/index-abc123.js", "Accept-Encoding: gzip, br\r\n");
    EXPECT_TRUE(Has(gzipped, "content-encoding: gzip")) << gzipped.head;
    EXPECT_TRUE(Has(gzipped, "vary: accept-encoding")) << gzipped.head;
    EXPECT_TRUE(Has(gzipped, "cache-control: public, max-age=31536000, immutable")) << gzipped.head;
    ASSERT_GE(gzipped.body.size(), 2u);
    EXPECT_EQ("\x1f\x8b", gzipped.body.substr(0, 2));
    EXPECT_LT(gzipped.body.size(), script.size() / 4);

    Answer plain = Get(server.port(), "/assets/index-abc123.js", "");
    EXPECT_EQ(std::string::npos, plain.head.find("content-encoding")) << plain.head;
    EXPECT_EQ(script, plain.body);

    Answer page = Get(server.port(), "/", "Accept-Encoding: gzip\r\n");
    EXPECT_TRUE(Has(page, "content-encoding: gzip")) << page.head;
    EXPECT_TRUE(Has(page, "cache-control: no-cache")) << page.head;

    // The web API's answers stay as they are written.
    Answer api = Get(server.port(), "/webapi/entry.cgi?api=KIVO.API.Info&version=1&method=query",
                     "Accept-Encoding: gzip\r\n");
    EXPECT_NE(std::string::npos, api.head.find("application/json")) << api.head;
    EXPECT_EQ(std::string::npos, api.head.find("content-encoding")) << api.head;
    EXPECT_EQ('{', api.body.empty() ? 0 : api.body[0]);
  }
}

}  // namespace
