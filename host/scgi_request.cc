#include "host/scgi_request.h"

#include <cerrno>
#include <cstring>
#include <unistd.h>

namespace {

// Digits of the netstring's length: enough for kMaxScgiHeadBytes, and a cap
// so a stream of digits cannot keep the reader going.
constexpr size_t kMaxLengthDigits = 8;

// Reads exactly `size` bytes into `out`; false when the stream ends first.
bool ReadExactly(int fd, char* out, size_t size) {
  size_t done = 0;
  while (done < size) {
    ssize_t n = read(fd, out + done, size - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

bool IsDecimal(const std::string& text) {
  return !text.empty() && text.size() <= 18 &&
         text.find_first_not_of("0123456789") == std::string::npos;
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

ScgiHeadResult ReadScgiHead(int fd, ScgiHeaders* headers) {
  // One byte at a time up to the ':', so not a byte of the body is taken.
  std::string digits;
  for (char c = 0;;) {
    if (!ReadExactly(fd, &c, 1)) return ScgiHeadResult::kClosed;
    if (c == ':') break;
    if (c < '0' || c > '9' || digits.size() == kMaxLengthDigits) return ScgiHeadResult::kMalformed;
    digits += c;
  }
  if (digits.empty() || (digits.size() > 1 && digits[0] == '0')) return ScgiHeadResult::kMalformed;
  size_t length = std::stoul(digits);
  if (length > kMaxScgiHeadBytes) return ScgiHeadResult::kTooLarge;
  std::string content(length + 1, '\0');  // the headers and the closing ','
  if (!ReadExactly(fd, &content[0], content.size())) return ScgiHeadResult::kClosed;
  if (content.back() != ',') return ScgiHeadResult::kMalformed;
  content.pop_back();
  return ParseScgiHeaders(content, headers) ? ScgiHeadResult::kOk : ScgiHeadResult::kMalformed;
}
