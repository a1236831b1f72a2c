// An exclusive advisory lock (flock) on a lock file, held for the lifetime of
// the object. Requests, workers and tools are separate processes, so state
// that several of them update (key/value files, sign-in attempts, sessions,
// the feed list) is guarded by a file lock rather than by anything in memory.
#pragma once

#include <string>

class FileLock {
 public:
  // Creates `path` (mode 0600) when missing and blocks until the lock is
  // held. Check held(): false (with errno set) when the file cannot be
  // opened or locked.
  explicit FileLock(const std::string& path);
  ~FileLock();
  FileLock(const FileLock&) = delete;
  FileLock& operator=(const FileLock&) = delete;

  bool held() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};
