// The head of an SCGI request as the web server sends it: a netstring
// "<length>:<headers>," whose content is NUL-terminated name and value pairs,
// CONTENT_LENGTH first. The request body follows the ',' and is left in the
// stream for the request code to read.
#pragma once

#include <cstddef>
#include <string>
#include <utility>
#include <vector>

using ScgiHeaders = std::vector<std::pair<std::string, std::string>>;

// A head larger than this is refused: the web server's own limits on request
// headers keep real heads far below it.
constexpr size_t kMaxScgiHeadBytes = 1 << 20;

enum class ScgiHeadResult {
  kOk,
  kClosed,     // the stream ended (or failed, or timed out) before the head was whole
  kMalformed,  // not a netstring of name/value pairs, or CONTENT_LENGTH missing or not first
  kTooLarge,   // the netstring's length is above kMaxScgiHeadBytes
};

// Reads the head from `fd` byte-exactly: nothing after the closing ',' is
// consumed, so the body stays readable on `fd`. On kOk `*headers` holds the
// pairs in the order sent.
[[nodiscard]] ScgiHeadResult ReadScgiHead(int fd, ScgiHeaders* headers);

// Parses the content of the netstring (without length and ','). False when a
// name or value lacks its NUL, a name is empty or holds '=', the first name
// is not CONTENT_LENGTH or its value is not a decimal number.
[[nodiscard]] bool ParseScgiHeaders(const std::string& content, ScgiHeaders* headers);
