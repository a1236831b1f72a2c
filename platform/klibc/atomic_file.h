// Whole-file reads and atomic whole-file writes.
//
// Files that other processes read (settings, feeds, session records) are
// written to a temporary file in the same directory and renamed over the old
// one, so a reader sees either the old or the new content, never half of it.
#pragma once

#include <string>

enum class SyncToDisk { No, Yes };

// Replaces `path` with `content`. The file gets `mode` (before umask).
// Returns false and sets the last error (KLIBC_ERR_NO_SPACE when the disk is
// full, KLIBC_ERR_FILE_WRITE otherwise) when anything fails; the old file is
// then untouched and no temporary file is left behind.
[[nodiscard]] bool KIVOWriteFileAtomic(const std::string& path, const std::string& content,
                                       SyncToDisk sync = SyncToDisk::Yes, unsigned mode = 0644);

// Reads the whole file into `*content`, at most `limit` bytes from its start.
// Returns false and sets the last error when it cannot be opened or read.
[[nodiscard]] bool KIVOReadFile(const std::string& path, std::string* content,
                                size_t limit = SIZE_MAX);

// True when `path` names an existing file system object (any type).
bool KLIBCFileExist(const char* path);

// Removes the regular files of `dir` whose names start with `prefix` and
// that were last changed more than `age_seconds` ago. Returns how many.
int KIVORemoveFilesOlderThan(const std::string& dir, const std::string& prefix, long age_seconds);

// mkdir -p with `mode` for the folders it creates. 0 on success, -1 on failure.
[[nodiscard]] int KIVOFSMkdirP(const char* path, unsigned mode = 0755);
