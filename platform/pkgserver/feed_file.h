// The feed list, "/usr/kivo/etc/packages/feeds" under the root: a JSON array
// of {"feed": address, "name": label, ...}. Changes are made under an
// exclusive lock on a file beside it, so two requests that change the list
// at once are applied one after the other and neither is lost; the file
// itself is always replaced whole (temporary file + rename).
#pragma once

#include <string>
#include <vector>

#include "klibc/file_lock.h"

namespace KIVOPackageServer {

// The feed file's path and its folder, under the root.
std::string PMSFeedFilePath();
std::string PMSFeedFolder();

// A listed feed: its "feed" address and its "name" ("" when it has none).
struct ListedFeed {
  std::string url;
  std::string name;
};

// The feeds of the list, in its order; elements without a string "feed"
// are skipped, and a missing or unreadable list has none.
std::vector<ListedFeed> PMSListedFeeds();

// Holds the feed list's lock for its lifetime. Check held(): false (with
// errno set) when the lock file cannot be made or locked.
class FeedFileLock : public FileLock {
 public:
  FeedFileLock();
};

}  // namespace KIVOPackageServer
