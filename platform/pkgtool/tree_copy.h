// Surveying and copying a folder tree without ever leaving it: the safety
// copy of a package's data folder before an upgrade (data_snapshot.h).
//
// Every folder is opened relative to its parent's descriptor with
// O_NOFOLLOW, and every file is checked to be the one the walk listed, so
// neither a symlink nor an entry swapped for one while the walk runs leads
// it outside the tree: a symlink is copied as a link, never followed. A copy
// keeps regular files (their blocks shared by a reflink where the file
// system can, else copied with copy_file_range), folders, symlinks, hard
// links between files of the tree, modes (setuid, setgid and sticky bits
// included), owners, access and modification times, and extended
// attributes (ACLs among them).
#pragma once

#include <cstdint>
#include <string>

// What a tree holds, as far as a copy of it is concerned.
struct TreeSurvey {
  // The room a full copy takes: each regular file its size in whole 4 KiB
  // blocks (at least one; a file with several hard links once), each folder
  // and symlink one block.
  uint64_t bytes = 0;
  // "" when the tree can be copied; else the first entry that cannot be,
  // and why ("run/app.sock is a socket"), in words for the administrator.
  std::string problem;
};

// Walks the folder `root`. False with survey->problem when it holds what
// cannot be copied safely: a fifo, a socket or a device; an entry that
// cannot be read; a symlink whose target leaves the tree (absolute, or
// climbing above `root`), since a copy could not hold what it points at;
// folders nested deeper than 128. Nothing is read beyond the entries'
// status, symlink targets and a test that each file opens.
[[nodiscard]] bool PMSSurveyTree(const std::string& root, TreeSurvey* survey);

enum class TreeCopyResult {
  kCopied,
  kRefused,  // an entry PMSSurveyTree refuses, or one that changed while it was copied
  kNoSpace,  // the file system filled up
  kFailed,   // any other error
};

// Copies the folder `from` to `to`, which must not exist (its parent must).
// On anything but kCopied, `to` may hold part of the copy, which the caller
// removes, and *error says what stopped the copy.
[[nodiscard]] TreeCopyResult PMSCopyTree(const std::string& from, const std::string& to,
                                         std::string* error);

// True when files in the folder `dir` can share blocks (FICLONE), so that
// a copy there takes no room. Probes with two small files made in `dir`
// and removed again; false when they cannot be made.
[[nodiscard]] bool PMSCanReflink(const std::string& dir);
