#include "tools/kivoctl/fallback_icon.h"

#include <cstdint>
#include <cstdlib>
#include <vector>

#include "klibc/atomic_file.h"

#include <png.h>

namespace {

struct Rgba {
  uint8_t r, g, b, a;
};

constexpr Rgba kClear{0, 0, 0, 0};
constexpr Rgba kBox{0x2f, 0x6f, 0xb8, 0xff};
constexpr Rgba kLid{0x4a, 0x8c, 0xd6, 0xff};
constexpr Rgba kBand{0xf2, 0xc1, 0x4e, 0xff};
constexpr Rgba kEdge{0x1d, 0x4a, 0x7e, 0xff};

// The colour at (x, y) of an icon `n` pixels wide, in fractions of the
// icon so that every size draws the same picture.
Rgba PixelAt(int x, int y, int n) {
  double fx = (x + 0.5) / n, fy = (y + 0.5) / n;
  const double left = 0.12, right = 0.88, top = 0.18, bottom = 0.86, lid = 0.36;
  if (fx < left || fx > right || fy < top || fy > bottom) return kClear;
  double edge = 0.025;
  if (fx < left + edge || fx > right - edge || fy < top + edge || fy > bottom - edge) return kEdge;
  if (fx > 0.45 && fx < 0.55) return kBand;
  if (fy < lid) return fy > lid - edge ? kEdge : kLid;
  return kBox;
}

}  // namespace

bool KIVOWriteFallbackIcon(const std::string& path, int size) {
  if (size <= 0 || size > 4096) return false;
  std::vector<Rgba> pixels(static_cast<size_t>(size) * size);
  for (int y = 0; y < size; ++y) {
    for (int x = 0; x < size; ++x) pixels[static_cast<size_t>(y) * size + x] = PixelAt(x, y, size);
  }
  png_image image{};
  image.version = PNG_IMAGE_VERSION;
  image.width = static_cast<png_uint_32>(size);
  image.height = static_cast<png_uint_32>(size);
  image.format = PNG_FORMAT_RGBA;
  png_alloc_size_t length = 0;
  // The first call measures, the second encodes into the buffer.
  if (!png_image_write_to_memory(&image, nullptr, &length, 0, pixels.data(), 0, nullptr)) {
    return false;
  }
  std::string png(length, '\0');
  if (!png_image_write_to_memory(&image, png.data(), &length, 0, pixels.data(), 0, nullptr)) {
    return false;
  }
  png.resize(length);
  return KIVOWriteFileAtomic(path, png, SyncToDisk::No, 0644);
}
