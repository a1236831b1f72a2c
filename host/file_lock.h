// An exclusive advisory lock (flock) on a lock file, held for the lifetime of
// the object. The host runs one process per request, so state that several
// requests update (sign-in attempts, sessions) is guarded by a file lock
// rather than by anything in memory.
#pragma once

#include <string>

class FileLock {
 public:
  // Creates `path` (mode 0600) when missing and blocks until the lock is
  // held. Check held(): false when the file cannot be opened or locked.
  explicit FileLock(const std::string& path);
  ~FileLock();
  FileLock(const FileLock&) = delete;
  FileLock& operator=(const FileLock&) = delete;

  bool held() const { return fd_ >= 0; }

 private:
  int fd_ = -1;
};
