#include "klibc/hex.h"

#include <sys/random.h>
#include <sys/types.h>
#include <vector>

bool KIVORandomHex(size_t bytes, std::string* out) {
  out->clear();
  std::vector<unsigned char> raw(bytes);
  // Up to 256 bytes come whole from one call once the pool is ready.
  if (getrandom(raw.data(), bytes, 0) != static_cast<ssize_t>(bytes)) return false;
  *out = KIVOHex(raw.data(), bytes);
  return true;
}
