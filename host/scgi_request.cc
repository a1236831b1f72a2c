#include "host/scgi_request.h"

#include <cerrno>
#include <cstdlib>
#include <unistd.h>

namespace {

// Digits of the netstring's length: enough for kMaxScgiHeadBytes, and a cap
// so a stream of digits cannot keep the reader going.
constexpr size_t kMaxLengthDigits = 8;

bool IsDecimal(const std::string& text) {
  return !text.empty() && text.size() <= 18 &&
         text.find_first_not_of("0123456789") == std::string::npos;
}

enum class Got { kBytes, kNothingYet, kEnd };

// Reads up to `size` bytes onto the end of `out`.
Got ReadSome(int fd, size_t size, std::string* out) {
  char buf[16384];
  for (;;) {
    ssize_t n = read(fd, buf, size < sizeof(buf) ? size : sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return Got::kNothingYet;
    if (n <= 0) return Got::kEnd;
    out->append(buf, static_cast<size_t>(n));
    return Got::kBytes;
  }
}

}  // namespace

bool ParseScgiHeaders(const std::string& content, ScgiHeaders* headers) {
  headers->clear();
  size_t at = 0;
  while (at < content.size()) {
    size_t name_end = content.find('\0', at);
    if (name_end == std::string::npos) return false;
    size_t value_end = content.find('\0', name_end + 1);
    if (value_end == std::string::npos) return false;
    std::string name = content.substr(at, name_end - at);
    if (name.empty() || name.find('=') != std::string::npos) return false;
    headers->emplace_back(std::move(name), content.substr(name_end + 1, value_end - name_end - 1));
    at = value_end + 1;
  }
  return !headers->empty() && headers->front().first == "CONTENT_LENGTH" &&
         IsDecimal(headers->front().second);
}

std::string ScgiRequestReader::Header(const std::string& name) const {
  for (const auto& header : headers_) {
    if (header.first == name) return header.second;
  }
  return "";
}

bool ScgiRequestReader::Fail(ScgiReadResult result) {
  state_ = State::kFailed;
  failure_ = result;
  return false;
}

size_t ScgiRequestReader::Wanted() const {
  switch (state_) {
    case State::kDigits:
      return 1;  // one byte at a time up to the ':', so not a byte more is taken
    case State::kContent:
      return head_length_ + 1 - content_.size();  // the headers and the closing ','
    case State::kBody:
      return content_length_ - body_.size();
    default:
      return 0;
  }
}

std::string* ScgiRequestReader::Buffer() {
  return state_ == State::kDigits ? &digits_ : state_ == State::kContent ? &content_ : &body_;
}

bool ScgiRequestReader::Advance() {
  if (state_ == State::kDigits) return DigitRead();
  if (state_ == State::kContent && content_.size() == head_length_ + 1) return HeadRead();
  if (state_ == State::kBody && body_.size() == content_length_) state_ = State::kDone;
  return true;
}

bool ScgiRequestReader::DigitRead() {
  char c = digits_.back();
  if (c != ':') {
    if (c >= '0' && c <= '9' && digits_.size() <= kMaxLengthDigits) return true;
    return Fail(ScgiReadResult::kMalformed);
  }
  digits_.pop_back();
  if (digits_.empty() || (digits_.size() > 1 && digits_[0] == '0'))
    return Fail(ScgiReadResult::kMalformed);
  head_length_ = std::strtoul(digits_.c_str(), nullptr, 10);
  if (head_length_ > kMaxScgiHeadBytes) return Fail(ScgiReadResult::kTooLarge);
  state_ = State::kContent;
  return true;
}

// The netstring is whole in content_: checks its end and parses it.
bool ScgiRequestReader::HeadRead() {
  if (content_.back() != ',') return Fail(ScgiReadResult::kMalformed);
  content_.pop_back();
  if (!ParseScgiHeaders(content_, &headers_)) return Fail(ScgiReadResult::kMalformed);
  content_.clear();
  content_length_ = std::strtoull(headers_.front().second.c_str(), nullptr, 10);
  state_ = content_length_ <= max_body_ ? State::kBody : State::kDone;
  return Advance();  // an empty body is whole already
}

ScgiReadResult ScgiRequestReader::ReadFrom(int fd) {
  for (;;) {
    if (state_ == State::kDone) return ScgiReadResult::kOk;
    if (state_ == State::kFailed) return failure_;
    switch (ReadSome(fd, Wanted(), Buffer())) {
      case Got::kNothingYet:
        return ScgiReadResult::kMore;
      case Got::kEnd:
        Fail(ScgiReadResult::kClosed);
        break;
      case Got::kBytes:
        Advance();
        break;
    }
  }
}
