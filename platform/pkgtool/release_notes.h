// A package's release notes: the optional member CHANGELOG of its file
// (docs/package-format.md), what the new version changes, in the author's
// words. `kivoctl build` takes it from the source folder's top, `kivoctl
// index` carries it into the catalogue entry as "changelog", and the page
// shows it before an upgrade.
//
// It is plain text, shown as text and never as markup: UTF-8, lines ending
// in LF (or CR LF), no other control character than a tab, and at most
// kPMSMaxReleaseNotesBytes, so that it fits a catalogue entry and a dialog.
#pragma once

#include <cstddef>
#include <string>

inline constexpr char kPMSReleaseNotesMember[] = "CHANGELOG";
inline constexpr size_t kPMSMaxReleaseNotesBytes = 16 << 10;

// "" when `text` keeps the rules above, else what breaks them, in words.
std::string PMSCheckReleaseNotes(const std::string& text);
