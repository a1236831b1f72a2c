#include "testing/payload_generator.h"

#include <algorithm>
#include <cstring>
#include <vector>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"

namespace {

// Half of each file is random bytes (media-like, incompressible), half text.
void WriteFile(const std::string& path, size_t size, uint64_t* seed) {
  std::vector<char> buf(size);
  for (size_t i = 0; i < size / 2; i += 8) {
    *seed ^= *seed << 13;
    *seed ^= *seed >> 7;
    *seed ^= *seed << 17;
    memcpy(&buf[i], seed, std::min<size_t>(8, size / 2 - i));
  }
  static const char kText[] = "The quick brown fox jumps over the lazy dog 0123456789.\n";
  for (size_t i = size / 2; i < size; ++i) buf[i] = kText[i % (sizeof(kText) - 1)];
  EXPECT_TRUE(KIVOWriteFileAtomic(path, std::string(buf.data(), size), SyncToDisk::No)) << path;
}

}  // namespace

// Mixed sizes: many small files, some medium ones, a few large ones.
uint64_t GeneratePayload(const std::string& dir, uint64_t total) {
  uint64_t written = 0, seed = 88172645463325252ull;
  int n = 0;
  const size_t kSizes[] = {4 << 10, 16 << 10, 64 << 10, 1 << 20, 4 << 20, 32 << 20};
  while (written < total) {
    size_t size = kSizes[n % 6];
    if (written + size > total) size = total - written;
    std::string sub = dir + "/d" + std::to_string(n % 37);
    EXPECT_EQ(0, KIVOFSMkdirP(sub.c_str())) << sub;
    WriteFile(sub + "/f" + std::to_string(n), size, &seed);
    written += size;
    ++n;
  }
  return written;
}
