// The SCGI request reader on a real socket pair: what the web server sends, what
// a broken or hostile peer might send, bytes that come in pieces, and that
// nothing is read past what the reader keeps.

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
// and reads the request from the other end with a reader that reads bodies
// up to `max_body`; `rest` gets what remains unread.
ScgiReadResult ReadFrom(const std::string& bytes, ScgiHeaders* headers, std::string* rest = nullptr,
                        bool close_after = true, size_t max_body = 0, std::string* body = nullptr) {
  int fds[2];
  EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, fds));
  EXPECT_EQ(static_cast<ssize_t>(bytes.size()), write(fds[0], bytes.data(), bytes.size()));
  if (close_after) shutdown(fds[0], SHUT_WR);
  ScgiRequestReader reader(max_body);
  ScgiReadResult result = reader.ReadFrom(fds[1]);
  *headers = reader.headers();
  if (body) *body = reader.body();
  if (rest) {
    shutdown(fds[0], SHUT_WR);
    char buf[256];
    for (ssize_t n; (n = read(fds[1], buf, sizeof(buf))) > 0;) rest->append(buf, n);
  }
  close(fds[0]);
  close(fds[1]);
  return result;
}

TEST(ScgiRequestTest, ReadsTheHeadsPairsInOrderAndLeavesALargerBody) {
  ScgiHeaders sent = {{"CONTENT_LENGTH", "11"},
                      {"SCGI", "1"},
                      {"REQUEST_METHOD", "POST"},
                      {"QUERY_STRING", ""},
                      {"HTTP_COOKIE", "id=a=b; x"}};
  ScgiHeaders got;
  std::string rest;
  ASSERT_EQ(ScgiReadResult::kOk,
            ReadFrom(Netstring(Pairs(sent)) + "api=x&y=1,2", &got, &rest, true, 10));
  EXPECT_EQ(sent, got);
  EXPECT_EQ("api=x&y=1,2", rest);  // not a byte of the body taken
}

TEST(ScgiRequestTest, ReadsASmallBodyWholeAndNothingAfterIt) {
  ScgiHeaders sent = {{"CONTENT_LENGTH", "11"}, {"REMOTE_ADDR", "192.0.2.1"}};
  ScgiHeaders got;
  std::string rest, body;
  ASSERT_EQ(ScgiReadResult::kOk, ReadFrom(Netstring(Pairs(sent)) + "api=x&y=1,2" + "next", &got,
                                          &rest, true, 11, &body));
  EXPECT_EQ(sent, got);
  EXPECT_EQ("api=x&y=1,2", body);
  EXPECT_EQ("next", rest);
  // A body cut short is a closed stream, with what came kept.
  ASSERT_EQ(ScgiReadResult::kClosed,
            ReadFrom(Netstring(Pairs(sent)) + "api=x", &got, nullptr, true, 11, &body));
  EXPECT_EQ("api=x", body);
}

// Bytes that come in pieces on a non-blocking connection: the reader answers
// "more" until the request is whole, then reads it on from where it was.
TEST(ScgiRequestTest, ReadsAsTheBytesArrive) {
  int fds[2];
  ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK, 0, fds));
  ScgiHeaders sent = {{"CONTENT_LENGTH", "4"}, {"REMOTE_ADDR", "192.0.2.1"}};
  std::string bytes = Netstring(Pairs(sent)) + "body";
  ScgiRequestReader reader(4);
  for (size_t at = 0; at < bytes.size(); at += 3) {
    EXPECT_EQ(ScgiReadResult::kMore, reader.ReadFrom(fds[1]));
    std::string piece = bytes.substr(at, 3);
    ASSERT_EQ(static_cast<ssize_t>(piece.size()), write(fds[0], piece.data(), piece.size()));
  }
  EXPECT_EQ(ScgiReadResult::kOk, reader.ReadFrom(fds[1]));
  EXPECT_EQ(sent, reader.headers());
  EXPECT_EQ("192.0.2.1", reader.Header("REMOTE_ADDR"));
  EXPECT_EQ("", reader.Header("HTTP_COOKIE"));
  EXPECT_EQ(4u, reader.content_length());
  EXPECT_TRUE(reader.reads_body());
  EXPECT_EQ("body", reader.body());
  close(fds[0]);
  close(fds[1]);
}

TEST(ScgiRequestTest, RefusesMalformedTruncatedAndOversizedHeads) {
  ScgiHeaders got;
  const std::string ok = Pairs({{"CONTENT_LENGTH", "0"}, {"SCGI", "1"}});
  // Not a netstring.
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom("x" + Netstring(ok), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(":" + ok + ",", &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom("0" + Netstring(ok), &got));  // leading zero
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom("999999999:", &got));         // too many digits
  std::string wrong_end = Netstring(ok);
  wrong_end.back() = ';';
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(wrong_end, &got));
  // Pairs broken: a value without its NUL, an empty name, '=' in a name,
  // CONTENT_LENGTH missing, not first or not a number, nothing at all.
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(Netstring(ok + "A\0b"), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(Netstring(ok + std::string("\0v\0", 3)), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(Netstring(ok + Pairs({{"A=B", "c"}})), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom(Netstring(Pairs({{"SCGI", "1"}})), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed,
            ReadFrom(Netstring(Pairs({{"SCGI", "1"}, {"CONTENT_LENGTH", "0"}})), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed,
            ReadFrom(Netstring(Pairs({{"CONTENT_LENGTH", "-1"}})), &got));
  EXPECT_EQ(ScgiReadResult::kMalformed, ReadFrom("0:,", &got));
  // The stream ends inside the length, inside the pairs, before the ','.
  EXPECT_EQ(ScgiReadResult::kClosed, ReadFrom("12", &got));
  EXPECT_EQ(ScgiReadResult::kClosed, ReadFrom(Netstring(ok).substr(0, 10), &got));
  std::string whole = Netstring(ok);
  EXPECT_EQ(ScgiReadResult::kClosed, ReadFrom(whole.substr(0, whole.size() - 1), &got));
  // A length above the cap is refused before anything is allocated or read.
  EXPECT_EQ(ScgiReadResult::kTooLarge,
            ReadFrom(std::to_string(kMaxScgiHeadBytes + 1) + ":", &got, nullptr, false));
}

}  // namespace
