#include "pkgserver/feed_file.h"

#include "klibc/sysroot.h"

namespace KIVOPackageServer {

std::string PMSFeedFolder() { return KIVORootPath("/usr/kivo/etc/packages"); }

std::string PMSFeedFilePath() { return PMSFeedFolder() + "/feeds"; }

FeedFileLock::FeedFileLock() : FileLock(PMSFeedFolder() + "/.feeds.lock") {}

}  // namespace KIVOPackageServer
