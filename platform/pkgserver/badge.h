// The update badge of the desktop: how many of the installed packages that
// came from the vendor's server it offers a newer, unrestricted version of.
#pragma once

#include <string>

#include <json/value.h>

namespace KIVOPackageTool {

// Counts the upgradable packages against the vendor's catalogue (cached
// unless `forceReload`) and stores {"count": N, "packages": [ids],
// "time": epoch seconds} atomically in PMSBadgeCountPath(), which the
// desktop reads. Returns N, or -1 (nothing stored) when the catalogue or the
// installed packages cannot be read.
int updateBadgeCount(bool forceReload);

// "/var/cache/kivo/pkgserver/upgrade_badge.json" under the system root.
std::string PMSBadgeCountPath();

}  // namespace KIVOPackageTool
