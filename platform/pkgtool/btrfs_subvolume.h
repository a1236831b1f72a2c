// Btrfs subvolumes as package data folders, so that the safety copy before
// an upgrade is a snapshot: one step whose cost does not grow with what the
// data holds, and which takes no room until the data and the copy differ.
//
// On a volume whose file system is Btrfs, a package's data folder is made
// a subvolume when the tool creates it (install). A data folder that is a
// plain folder (made before, or on another file system) stays one and is
// copied file by file (tree_copy.h). A snapshot of a subvolume is itself a
// subvolume: it is renamed like any folder, and removed by
// PMSDestroySubvolume (PMSRemoveTree does so for every copy and data folder).
#pragma once

#include <string>

// True when `path` lies on a Btrfs file system.
bool PMSOnBtrfs(const std::string& path);

// True when `path` (not followed when it is a symlink) is the top folder of
// a Btrfs subvolume, a snapshot included.
bool PMSIsSubvolume(const std::string& path);

// True when the data folder `path` is copied by a snapshot: it is a
// subvolume and no subvolume lies inside it. A snapshot leaves a subvolume
// inside its source out (an empty folder stands in its place), so such a
// data folder, like a plain one, is copied file by file. The one place that
// rule lives: the copy and its room both follow it.
bool PMSCopiesBySnapshot(const std::string& path);

// Makes the folder `path` as a new, empty subvolume with `mode`; `path`
// must not exist and its parent must be on Btrfs. False (errno set) when it
// could not be made.
[[nodiscard]] bool PMSMakeSubvolume(const std::string& path, unsigned mode);

// Makes `to` a read-write snapshot of the subvolume `from`; `to` must not
// exist and its parent must be on the same file system. Failure with errno
// set (ENOSPC when the file system is full).
[[nodiscard]] bool PMSSnapshotSubvolume(const std::string& from, const std::string& to);

// Removes the subvolume `path` with everything in it, in one step. False
// (errno set) when the kernel refuses, for instance because a subvolume
// lies inside it (ENOTEMPTY): the caller then empties it file by file.
[[nodiscard]] bool PMSDestroySubvolume(const std::string& path);
