// A file descriptor closed when it goes out of scope, so that every return
// of a function that walks folders by descriptor closes what it opened.
#pragma once

#include <unistd.h>

class ScopedFd {
 public:
  // Takes `fd` (may be -1, which is never closed).
  explicit ScopedFd(int fd) : fd_(fd) {}
  ~ScopedFd() {
    if (fd_ >= 0) close(fd_);
  }
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};
