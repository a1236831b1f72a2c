#include "webapi/url_encoded.h"

namespace {

int HexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

bool UrlDecode(const std::string& in, std::string* out) {
  out->clear();
  out->reserve(in.size());
  for (size_t i = 0; i < in.size(); ++i) {
    char c = in[i];
    if (c == '\0') return false;
    if (c == '+') {
      *out += ' ';
    } else if (c != '%') {
      *out += c;
    } else {
      int hi = i + 2 < in.size() ? HexValue(in[i + 1]) : -1;
      int lo = hi >= 0 ? HexValue(in[i + 2]) : -1;
      if (lo < 0 || hi * 16 + lo == 0) return false;
      *out += static_cast<char>(hi * 16 + lo);
      i += 2;
    }
  }
  return true;
}

bool ParseUrlEncoded(const std::string& text, FormFields* out, std::string* error) {
  size_t start = 0;
  while (start <= text.size()) {
    size_t end = text.find('&', start);
    if (end == std::string::npos) end = text.size();
    std::string field = text.substr(start, end - start);
    start = end + 1;
    if (field.empty()) continue;
    size_t eq = field.find('=');
    std::string name, value;
    if (!UrlDecode(field.substr(0, eq), &name) ||
        (eq != std::string::npos && !UrlDecode(field.substr(eq + 1), &value))) {
      *error = "invalid percent-encoding or NUL byte in field " + std::to_string(out->size() + 1);
      return false;
    }
    out->emplace_back(std::move(name), std::move(value));
  }
  return true;
}
