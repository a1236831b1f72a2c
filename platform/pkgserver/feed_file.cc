#include "pkgserver/feed_file.h"

#include "klibc/sysroot.h"
#include "settings/web_utils.h"

namespace KIVOPackageServer {

std::string PMSFeedFolder() { return KIVORootPath("/usr/kivo/etc/packages"); }

std::string PMSFeedFilePath() { return PMSFeedFolder() + "/feeds"; }

std::vector<ListedFeed> PMSListedFeeds() {
  Json::Value feeds;
  std::vector<ListedFeed> listed;
  if (!WebUtils::LoadJsonFile(PMSFeedFilePath(), feeds) || !feeds.isArray()) return listed;
  for (const Json::Value& feed : feeds) {
    if (!feed.isObject() || !feed["feed"].isString()) continue;
    listed.push_back(
        {feed["feed"].asString(), feed["name"].isString() ? feed["name"].asString() : ""});
  }
  return listed;
}

FeedFileLock::FeedFileLock() : FileLock(PMSFeedFolder() + "/.feeds.lock") {}

}  // namespace KIVOPackageServer
