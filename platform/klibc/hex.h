// Lower-case hex, the one form this system gives bytes as text in: digests,
// nonces, task and session ids.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

// The encoder and the check are inline, so that the transfer library, which
// is loaded on its own and links no platform library, uses them too.
inline constexpr char kKIVOHexDigits[] = "0123456789abcdef";

// `size` bytes from `data` as 2 * `size` lower-case hex digits.
inline std::string KIVOHex(const void* data, size_t size) {
  const unsigned char* bytes = static_cast<const unsigned char*>(data);
  std::string hex;
  hex.reserve(2 * size);
  for (size_t i = 0; i < size; ++i) {
    hex += kKIVOHexDigits[bytes[i] >> 4];
    hex += kKIVOHexDigits[bytes[i] & 15];
  }
  return hex;
}

// True when `text` is one or more lower-case hex digits and nothing else.
inline bool KIVOIsLowerHex(std::string_view text) {
  return !text.empty() && text.find_first_not_of(kKIVOHexDigits) == std::string_view::npos;
}

// `bytes` bytes from the kernel's random source (getrandom) as lower-case
// hex in *out. False, with *out empty, when the system has none to give
// (a short read counts as none: nothing is padded).
[[nodiscard]] bool KIVORandomHex(size_t bytes, std::string* out);
