// The SCGI head reader on a real socket pair: what the web server sends, what
// a broken or hostile peer might send, and that the body is left unread.

#include "host/scgi_request.h"

#include <string>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace {

std::string Netstring(const std::string& content) {
  return std::to_string(content.size()) + ":" + content + ",";
}

std::string Pairs(const ScgiHeaders& headers) {
  std::string out;
  for (const auto& h : headers) out += h.first + '\0' + h.second + '\0';
  return out;
}

// Writes `bytes` into one end of a socket pair, closes it when `close_after`,
// and reads the head from the other end; `rest` gets what remains unread.
ScgiHeadResult ReadFrom(const std::string& bytes, ScgiHeaders* headers, std::string* rest = nullptr,
                        bool close_after = true) {
  int fds[2];
  EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, fds));
  EXPECT_EQ(static_cast<ssize_t>(bytes.size()), write(fds[0], bytes.data(), bytes.size()));
  if (close_after) shutdown(fds[0], SHUT_WR);
  ScgiHeadResult result = ReadScgiHead(fds[1], headers);
  if (rest) {
    shutdown(fds[0], SHUT_WR);
    char buf[256];
    for (ssize_t n; (n = read(fds[1], buf, sizeof(buf))) > 0;) rest->append(buf, n);
  }
  close(fds[0]);
  close(fds[1]);
  return result;
}

TEST(ScgiRequestTest, ReadsTheHeadsPairsInOrderAndLeavesTheBody) {
  ScgiHeaders sent = {{"CONTENT_LENGTH", "11"},
                      {"SCGI", "1"},
                      {"REQUEST_METHOD", "POST"},
                      {"QUERY_STRING", ""},
                      {"HTTP_COOKIE", "id=a=b; x"}};
  ScgiHeaders got;
  std::string rest;
  ASSERT_EQ(ScgiHeadResult::kOk, ReadFrom(Netstring(Pairs(sent)) + "api=x&y=1,2", &got, &rest));
  EXPECT_EQ(sent, got);
  EXPECT_EQ("api=x&y=1,2", rest);  // not a byte of the body taken
}

TEST(ScgiRequestTest, RefusesMalformedTruncatedAndOversizedHeads) {
  ScgiHeaders got;
  const std::string ok = Pairs({{"CONTENT_LENGTH", "0"}, {"SCGI", "1"}});
  // Not a netstring.
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom("x" + Netstring(ok), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(":" + ok + ",", &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom("0" + Netstring(ok), &got));  // leading zero
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom("999999999:", &got));         // too many digits
  std::string wrong_end = Netstring(ok);
  wrong_end.back() = ';';
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(wrong_end, &got));
  // Pairs broken: a value without its NUL, an empty name, '=' in a name,
  // CONTENT_LENGTH missing, not first or not a number, nothing at all.
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(Netstring(ok + "A\0b"), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(Netstring(ok + std::string("\0v\0", 3)), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(Netstring(ok + Pairs({{"A=B", "c"}})), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom(Netstring(Pairs({{"SCGI", "1"}})), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed,
            ReadFrom(Netstring(Pairs({{"SCGI", "1"}, {"CONTENT_LENGTH", "0"}})), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed,
            ReadFrom(Netstring(Pairs({{"CONTENT_LENGTH", "-1"}})), &got));
  EXPECT_EQ(ScgiHeadResult::kMalformed, ReadFrom("0:,", &got));
  // The stream ends inside the length, inside the pairs, before the ','.
  EXPECT_EQ(ScgiHeadResult::kClosed, ReadFrom("12", &got));
  EXPECT_EQ(ScgiHeadResult::kClosed, ReadFrom(Netstring(ok).substr(0, 10), &got));
  std::string whole = Netstring(ok);
  EXPECT_EQ(ScgiHeadResult::kClosed, ReadFrom(whole.substr(0, whole.size() - 1), &got));
  // A length above the cap is refused before anything is allocated or read.
  EXPECT_EQ(ScgiHeadResult::kTooLarge,
            ReadFrom(std::to_string(kMaxScgiHeadBytes + 1) + ":", &got, nullptr, false));
}

}  // namespace
