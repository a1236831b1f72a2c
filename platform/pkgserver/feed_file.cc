#include "pkgserver/feed_file.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include "klibc/sysroot.h"

namespace KIVOPackageServer {

std::string PMSFeedFolder() { return KIVORootPath("/usr/kivo/etc/packages"); }

std::string PMSFeedFilePath() { return PMSFeedFolder() + "/feeds"; }

FeedFileLock::FeedFileLock() {
  const std::string path = PMSFeedFolder() + "/.feeds.lock";
  fd_ = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (fd_ < 0) return;
  int rc;
  do {
    rc = flock(fd_, LOCK_EX);
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    int saved = errno;
    close(fd_);
    fd_ = -1;
    errno = saved;
  }
}

FeedFileLock::~FeedFileLock() {
  if (fd_ >= 0) close(fd_);
}

}  // namespace KIVOPackageServer
