#include "pkgtool/release_notes.h"

namespace {

// The length of the UTF-8 sequence at `s[i]` (shortest form, no surrogates,
// at most U+10FFFF); 0 when none starts there.
size_t Utf8Length(const std::string& s, size_t i) {
  const auto at = [&](size_t k) { return static_cast<unsigned char>(s[k]); };
  const unsigned char c = at(i);
  if (c < 0x80) return 1;
  size_t n = c >= 0xC2 && c <= 0xDF   ? 2
             : c >= 0xE0 && c <= 0xEF ? 3
             : c >= 0xF0 && c <= 0xF4 ? 4
                                      : 0;
  if (n == 0 || i + n > s.size()) return 0;
  for (size_t k = 1; k < n; ++k) {
    if ((at(i + k) & 0xC0) != 0x80) return 0;
  }
  const unsigned char second = at(i + 1);
  if ((c == 0xE0 && second < 0xA0) || (c == 0xED && second > 0x9F) ||
      (c == 0xF0 && second < 0x90) || (c == 0xF4 && second > 0x8F)) {
    return 0;
  }
  return n;
}

}  // namespace

std::string PMSCheckReleaseNotes(const std::string& text) {
  if (text.size() > kPMSMaxReleaseNotesBytes) {
    return std::string(kPMSReleaseNotesMember) + " is larger than " +
           std::to_string(kPMSMaxReleaseNotesBytes >> 10) + " KiB";
  }
  for (size_t i = 0; i < text.size();) {
    const unsigned char c = static_cast<unsigned char>(text[i]);
    const bool control = c < 0x20 || c == 0x7F;
    const bool line_end = c == '\n' || (c == '\r' && i + 1 < text.size() && text[i + 1] == '\n');
    if (control && c != '\t' && !line_end) {
      return std::string(kPMSReleaseNotesMember) + " holds a control character at byte " +
             std::to_string(i);
    }
    const size_t n = Utf8Length(text, i);
    if (n == 0) {
      return std::string(kPMSReleaseNotesMember) + " is not UTF-8 text (byte " + std::to_string(i) +
             ")";
    }
    i += n;
  }
  return "";
}
