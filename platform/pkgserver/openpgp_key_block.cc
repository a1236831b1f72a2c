#include "pkgserver/openpgp_key_block.h"

#include <cstdint>
#include <string>

namespace KIVOPackageServer {

namespace {

// Packet tags (RFC 4880, section 4.3).
enum PacketTag : int {
  kSignature = 2,
  kSecretKey = 5,
  kPublicKey = 6,
  kSecretSubkey = 7,
  kTrust = 12,
  kUserId = 13,
  kPublicSubkey = 14,
  kUserAttribute = 17,
};

// The base64 text between the armor's header block and its checksum line;
// false when the armor's shape is wrong.
bool ArmorBody(std::string_view text, std::string* body) {
  size_t at = text.find("-----BEGIN PGP ");
  if (at == std::string_view::npos || (at = text.find('\n', at)) == std::string_view::npos)
    return false;
  // Header lines ("Comment: ...") run up to the first empty line.
  size_t blank = text.find("\n\n", at);
  size_t blank_crlf = text.find("\n\r\n", at);
  size_t start = std::min(blank, blank_crlf);
  if (start == std::string_view::npos) return false;
  start = text.find('\n', start + 1) + 1;
  size_t end = text.find("-----END PGP ", start);
  if (end == std::string_view::npos) return false;
  for (size_t i = start; i < end; ++i) {
    const char c = text[i];
    if (c == '=' && (i == start || text[i - 1] == '\n')) break;  // the checksum line
    if (c != '\r' && c != '\n' && c != ' ') body->push_back(c);
  }
  return true;
}

int Base64Value(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

// Decodes base64 with optional '=' padding at the end only. A decoder of our
// own: this library is loaded by every web API request, and a crypto library
// beside it for these few lines would cost every request its load.
bool DecodeBase64(const std::string& in, std::string* out) {
  uint32_t bits = 0;
  int count = 0;
  size_t padding = 0;
  for (char c : in) {
    if (c == '=') {
      ++padding;
      continue;
    }
    const int v = Base64Value(c);
    if (v < 0 || padding > 0) return false;
    bits = (bits << 6) | static_cast<uint32_t>(v);
    if (++count == 4) {
      out->push_back(static_cast<char>(bits >> 16));
      out->push_back(static_cast<char>(bits >> 8));
      out->push_back(static_cast<char>(bits));
      bits = 0;
      count = 0;
    }
  }
  if (padding > 2 || (count + padding) % 4 != 0 || count == 1) return false;
  if (count == 2) out->push_back(static_cast<char>(bits >> 4));
  if (count == 3) {
    out->push_back(static_cast<char>(bits >> 10));
    out->push_back(static_cast<char>(bits >> 2));
  }
  return true;
}

// Reads the header of the packet at *pos: its tag, and moves *pos past the
// packet. False on a header or body that runs past the data, or on a
// partial (streamed) length, which key blocks never use.
bool NextPacket(const std::string& data, size_t* pos, int* tag) {
  auto byte = [&](size_t i) { return static_cast<uint8_t>(data[i]); };
  if (*pos >= data.size() || !(byte(*pos) & 0x80)) return false;
  const uint8_t head = byte((*pos)++);
  uint64_t length = 0;
  size_t length_bytes = 0;
  if (head & 0x40) {  // new format
    *tag = head & 0x3f;
    if (*pos >= data.size()) return false;
    const uint8_t first = byte(*pos);
    if (first < 192) {
      length = first, length_bytes = 1;
    } else if (first < 224) {
      if (*pos + 1 >= data.size()) return false;
      length = ((first - 192) << 8) + byte(*pos + 1) + 192, length_bytes = 2;
    } else if (first == 255) {
      length_bytes = 5;
    } else {
      return false;
    }
    if (length_bytes == 5) {
      if (*pos + 4 >= data.size()) return false;
      for (size_t i = 1; i <= 4; ++i) length = (length << 8) | byte(*pos + i);
    }
  } else {  // old format
    *tag = (head >> 2) & 0x0f;
    const int type = head & 0x03;
    if (type == 3) return false;
    length_bytes = size_t{1} << type;
    if (*pos + length_bytes > data.size()) return false;
    for (size_t i = 0; i < length_bytes; ++i) length = (length << 8) | byte(*pos + i);
  }
  *pos += length_bytes;
  if (length > data.size() - *pos) return false;
  *pos += static_cast<size_t>(length);
  return true;
}

}  // namespace

KeyBlockContent PMSKeyBlockContent(std::string_view text) {
  std::string base64, data;
  if (!ArmorBody(text, &base64) || !DecodeBase64(base64, &data) || data.empty())
    return KeyBlockContent::kNotAKey;
  bool first = true;
  for (size_t pos = 0; pos < data.size(); first = false) {
    int tag = 0;
    if (!NextPacket(data, &pos, &tag)) return KeyBlockContent::kNotAKey;
    switch (tag) {
      case kSecretKey:
      case kSecretSubkey:
        return KeyBlockContent::kSecretKey;
      case kPublicKey:
        break;
      case kSignature:
      case kTrust:
      case kUserId:
      case kPublicSubkey:
      case kUserAttribute:
        if (first) return KeyBlockContent::kNotAKey;
        break;
      default:
        return KeyBlockContent::kNotAKey;
    }
  }
  return KeyBlockContent::kPublicKey;
}

}  // namespace KIVOPackageServer
