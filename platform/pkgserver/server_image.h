// Images of server packages (icons, screenshots), fetched from the link a
// catalogue gives and cached under the root:
// "/var/cache/kivo/pkgserver/images/<source>/<package>/<version>/<file>".
#pragma once

#include <cstddef>

namespace KIVOPackageTool {

// `source` is "AVAIL/KIVO" or "AVAIL/OTHER"; `package`, `version` and
// `file` name the image and are validated whole (package id, version,
// a plain file name). With `buffer`: the cached image's path is written
// into it, fetching it from `link` first when it is not cached (and a link
// is given); nonzero when the path was written. Without a buffer (null, 0)
// the image is only queued for a background fetch when missing, so a
// catalogue with many icons never holds up its caller; the answer is then
// nonzero when the image is cached already.
int PMSGetServerImage(const char* source, const char* package, const char* version,
                      const char* file, const char* link, char* buffer, size_t size);

}  // namespace KIVOPackageTool
