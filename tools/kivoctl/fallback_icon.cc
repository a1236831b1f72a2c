#include "tools/kivoctl/fallback_icon.h"

#include <algorithm>
#include <cctype>
#include <cmath>
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

constexpr int kMaxSize = 4096;

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

// Encodes `pixels` (`size` x `size`, rows top down) as a PNG and writes it to
// `path` atomically.
bool WritePng(const std::string& path, int size, const std::vector<Rgba>& pixels) {
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

// The letters of a letter icon, 5 x 7 cells each, '#' drawn.
struct Glyph {
  char letter;
  const char* rows[7];
};

constexpr Glyph kGlyphs[] = {
    {'A', {".###.", "#...#", "#...#", "#####", "#...#", "#...#", "#...#"}},
    {'B', {"####.", "#...#", "#...#", "####.", "#...#", "#...#", "####."}},
    {'C', {".###.", "#...#", "#....", "#....", "#....", "#...#", ".###."}},
    {'D', {"####.", "#...#", "#...#", "#...#", "#...#", "#...#", "####."}},
    {'E', {"#####", "#....", "#....", "####.", "#....", "#....", "#####"}},
    {'F', {"#####", "#....", "#....", "####.", "#....", "#....", "#...."}},
    {'G', {".###.", "#...#", "#....", "#.###", "#...#", "#...#", ".###."}},
    {'H', {"#...#", "#...#", "#...#", "#####", "#...#", "#...#", "#...#"}},
    {'I', {".###.", "..#..", "..#..", "..#..", "..#..", "..#..", ".###."}},
    {'J', {"..###", "...#.", "...#.", "...#.", "...#.", "#..#.", ".##.."}},
    {'K', {"#...#", "#..#.", "#.#..", "##...", "#.#..", "#..#.", "#...#"}},
    {'L', {"#....", "#....", "#....", "#....", "#....", "#....", "#####"}},
    {'M', {"#...#", "##.##", "#.#.#", "#.#.#", "#...#", "#...#", "#...#"}},
    {'N', {"#...#", "#...#", "##..#", "#.#.#", "#..##", "#...#", "#...#"}},
    {'O', {".###.", "#...#", "#...#", "#...#", "#...#", "#...#", ".###."}},
    {'P', {"####.", "#...#", "#...#", "####.", "#....", "#....", "#...."}},
    {'Q', {".###.", "#...#", "#...#", "#...#", "#.#.#", "#..#.", ".##.#"}},
    {'R', {"####.", "#...#", "#...#", "####.", "#.#..", "#..#.", "#...#"}},
    {'S', {".####", "#....", "#....", ".###.", "....#", "....#", "####."}},
    {'T', {"#####", "..#..", "..#..", "..#..", "..#..", "..#..", "..#.."}},
    {'U', {"#...#", "#...#", "#...#", "#...#", "#...#", "#...#", ".###."}},
    {'V', {"#...#", "#...#", "#...#", "#...#", "#...#", ".#.#.", "..#.."}},
    {'W', {"#...#", "#...#", "#...#", "#.#.#", "#.#.#", "#.#.#", ".#.#."}},
    {'X', {"#...#", "#...#", ".#.#.", "..#..", ".#.#.", "#...#", "#...#"}},
    {'Y', {"#...#", "#...#", ".#.#.", "..#..", "..#..", "..#..", "..#.."}},
    {'Z', {"#####", "....#", "...#.", "..#..", ".#...", "#....", "#####"}},
    {'0', {".###.", "#...#", "#..##", "#.#.#", "##..#", "#...#", ".###."}},
    {'1', {"..#..", ".##..", "..#..", "..#..", "..#..", "..#..", ".###."}},
    {'2', {".###.", "#...#", "....#", "...#.", "..#..", ".#...", "#####"}},
    {'3', {"####.", "....#", "....#", ".###.", "....#", "....#", "####."}},
    {'4', {"...#.", "..##.", ".#.#.", "#..#.", "#####", "...#.", "...#."}},
    {'5', {"#####", "#....", "####.", "....#", "....#", "#...#", ".###."}},
    {'6', {"..##.", ".#...", "#....", "####.", "#...#", "#...#", ".###."}},
    {'7', {"#####", "....#", "...#.", "..#..", ".#...", ".#...", ".#..."}},
    {'8', {".###.", "#...#", "#...#", ".###.", "#...#", "#...#", ".###."}},
    {'9', {".###.", "#...#", "#...#", ".####", "....#", "...#.", ".##.."}},
};

const Glyph* GlyphOf(char letter) {
  char upper = static_cast<char>(std::toupper(static_cast<unsigned char>(letter)));
  for (const Glyph& g : kGlyphs) {
    if (g.letter == upper) return &g;
  }
  return nullptr;
}

// The tile's colour for `id`: a hue from a hash of the id (FNV-1a), dark
// enough that the white letter stands out, a little lighter at the top.
Rgba TileColour(const std::string& id, double fy) {
  uint32_t hash = 2166136261u;
  for (unsigned char c : id) hash = (hash ^ c) * 16777619u;
  double hue = (hash % 360) / 60.0, saturation = 0.55, lightness = 0.42 - 0.08 * fy;
  double chroma = (1 - std::fabs(2 * lightness - 1)) * saturation;
  double x = chroma * (1 - std::fabs(std::fmod(hue, 2) - 1));
  double r = 0, g = 0, b = 0;
  switch (static_cast<int>(hue)) {
    case 0:
      r = chroma, g = x;
      break;
    case 1:
      r = x, g = chroma;
      break;
    case 2:
      g = chroma, b = x;
      break;
    case 3:
      g = x, b = chroma;
      break;
    case 4:
      r = x, b = chroma;
      break;
    default:
      r = chroma, b = x;
      break;
  }
  double m = lightness - chroma / 2;
  auto channel = [m](double v) { return static_cast<uint8_t>(std::lround((v + m) * 255)); };
  return {channel(r), channel(g), channel(b), 0xff};
}

// Whether the point (fx, fy), in fractions of the icon, lies on the tile: a
// square with rounded corners, inset a little.
bool OnTile(double fx, double fy) {
  const double inset = 0.06, radius = 0.2;
  double dx = std::max({inset + radius - fx, 0.0, fx - (1 - inset - radius)});
  double dy = std::max({inset + radius - fy, 0.0, fy - (1 - inset - radius)});
  if (fx < inset || fx > 1 - inset || fy < inset || fy > 1 - inset) return false;
  return dx * dx + dy * dy <= radius * radius;
}

// Whether the point lies on the glyph, drawn half the icon high, centred.
bool OnGlyph(const Glyph& glyph, double fx, double fy) {
  const double cell = 0.5 / 7, left = 0.5 - 2.5 * cell, top = 0.5 - 3.5 * cell;
  int column = static_cast<int>(std::floor((fx - left) / cell));
  int row = static_cast<int>(std::floor((fy - top) / cell));
  return column >= 0 && column < 5 && row >= 0 && row < 7 && glyph.rows[row][column] == '#';
}

// One pixel of a letter icon, its edges smoothed by sampling it 4 x 4 times.
Rgba LetterPixelAt(const Glyph& glyph, const std::string& id, int x, int y, int n) {
  constexpr int kSamples = 4;
  int tile = 0, letter = 0;
  for (int sy = 0; sy < kSamples; ++sy) {
    for (int sx = 0; sx < kSamples; ++sx) {
      double fx = (x + (sx + 0.5) / kSamples) / n, fy = (y + (sy + 0.5) / kSamples) / n;
      if (!OnTile(fx, fy)) continue;
      ++tile;
      if (OnGlyph(glyph, fx, fy)) ++letter;
    }
  }
  if (tile == 0) return kClear;
  Rgba base = TileColour(id, (y + 0.5) / n);
  double white = static_cast<double>(letter) / tile;
  auto mix = [white](uint8_t c) {
    return static_cast<uint8_t>(std::lround(c + (255 - c) * white));
  };
  return {mix(base.r), mix(base.g), mix(base.b),
          static_cast<uint8_t>(std::lround(255.0 * tile / (kSamples * kSamples)))};
}

}  // namespace

bool KIVOWriteFallbackIcon(const std::string& path, int size) {
  if (size <= 0 || size > kMaxSize) return false;
  std::vector<Rgba> pixels(static_cast<size_t>(size) * size);
  for (int y = 0; y < size; ++y) {
    for (int x = 0; x < size; ++x) pixels[static_cast<size_t>(y) * size + x] = PixelAt(x, y, size);
  }
  return WritePng(path, size, pixels);
}

bool KIVOIsIconLetter(char letter) { return GlyphOf(letter) != nullptr; }

bool KIVOWriteLetterIcon(const std::string& path, int size, const std::string& id, char letter) {
  const Glyph* glyph = GlyphOf(letter);
  if (!glyph || size <= 0 || size > kMaxSize) return false;
  std::vector<Rgba> pixels(static_cast<size_t>(size) * size);
  for (int y = 0; y < size; ++y) {
    for (int x = 0; x < size; ++x) {
      pixels[static_cast<size_t>(y) * size + x] = LetterPixelAt(*glyph, id, x, y, size);
    }
  }
  return WritePng(path, size, pixels);
}
