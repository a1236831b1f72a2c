// SHA-256 of short texts (addresses, names), for keys that another party
// chooses and so must not collide. Written out here rather than taken from
// OpenSSL: it is needed by requests of the light library (an image lookup
// per icon), and loading libcrypto costs about a millisecond per process,
// more than hashing a few hundred bytes takes. Files are hashed by the
// package-file library's Sha256 (pkgtool/sha256.h), which uses the CPU's
// SHA instructions.
#pragma once

#include <string>
#include <string_view>

// The digest of `text` as 64 lower-case hex digits.
std::string PMSTextSha256Hex(std::string_view text);
