// An SCGI request as the web server sends it: a netstring
// "<length>:<headers>," whose content is NUL-terminated name and value pairs,
// CONTENT_LENGTH first, then the body.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

using ScgiHeaders = std::vector<std::pair<std::string, std::string>>;

// A head larger than this is refused: the web server's own limits on request
// headers keep real heads far below it, and kivo-webd holds the head of every
// connection it has not yet given a request process.
constexpr size_t kMaxScgiHeadBytes = 64 << 10;

enum class ScgiReadResult {
  kMore,       // the connection has nothing more to read right now
  kOk,         // the head is whole, and the body too when it is read here
  kClosed,     // the stream ended (or failed) first
  kMalformed,  // not a netstring of name/value pairs, or CONTENT_LENGTH missing or not first
  kTooLarge,   // the netstring's length is above kMaxScgiHeadBytes
};

// Reads one request from a connection as its bytes arrive, in as many calls
// as it takes: the head, then the body if it is at most `max_body` bytes (a
// larger body stays in the connection for the request code). Never reads a
// byte past what it keeps.
class ScgiRequestReader {
 public:
  explicit ScgiRequestReader(size_t max_body) : max_body_(max_body) {}

  // Reads what `fd` holds. On a non-blocking descriptor it returns kMore when
  // nothing more is there yet; on a blocking one it waits. Once it has
  // answered anything but kMore it answers the same again.
  [[nodiscard]] ScgiReadResult ReadFrom(int fd);

  // Whether the head is whole; the rest holds only then.
  bool head_done() const { return state_ == State::kBody || state_ == State::kDone; }
  const ScgiHeaders& headers() const { return headers_; }
  uint64_t content_length() const { return content_length_; }
  // The value of the first header `name`; empty when there is none.
  std::string Header(const std::string& name) const;
  // Whether the body is read here (its length is at most `max_body`).
  bool reads_body() const { return head_done() && content_length_ <= max_body_; }
  // The body bytes read so far (all of them once ReadFrom answered kOk).
  const std::string& body() const { return body_; }

 private:
  enum class State { kDigits, kContent, kBody, kDone, kFailed };
  // Ends reading with `result`; false.
  bool Fail(ScgiReadResult result);
  // Bytes the current part still lacks, and the buffer that collects it.
  size_t Wanted() const;
  std::string* Buffer();
  // Takes the bytes just read into Buffer() a step further; false on failure.
  bool Advance();
  bool DigitRead();
  bool HeadRead();

  size_t max_body_;
  State state_ = State::kDigits;
  ScgiReadResult failure_ = ScgiReadResult::kClosed;
  std::string digits_;
  size_t head_length_ = 0;
  std::string content_;
  ScgiHeaders headers_;
  uint64_t content_length_ = 0;
  std::string body_;
};

// Parses the content of the netstring (without length and ','). False when a
// name or value lacks its NUL, a name is empty or holds '=', the first name
// is not CONTENT_LENGTH or its value is not a decimal number.
[[nodiscard]] bool ParseScgiHeaders(const std::string& content, ScgiHeaders* headers);
