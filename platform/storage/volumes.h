// The appliance's volumes, as configured under the system root. This file
// stands in for the storage manager, which is not part of the package center:
//
//   /etc/kivo/volumes.json  [{"path": "/volume1", "status": "normal",
//                             "cap_bytes": 0, "brick": false}, ...]
//
// An entry without a string "path", or whose path is not absolute or holds
// "..", is left out; a missing "status" is "normal", a missing "cap_bytes"
// 0 and a missing "brick" false.
// The file is read again only after it changes, so any thread may call these
// as often as it likes.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct VolumeConfig {
  std::string path;        // "/volume1", as the appliance names it
  std::string status;      // "normal", "degraded", "crashed", ...
  uint64_t cap_bytes = 0;  // caps the free space when above 0 (volume_space.h)
  bool brick = false;      // serves as a cluster file system brick

  bool usable() const { return status == "normal" || status == "degraded"; }
};

// The configuration file, resolved under the system root.
std::string KIVOVolumesFile();

// Every configured volume, in file order. A missing, unreadable or malformed
// file configures no volume: the list is then empty, which every caller
// already answers as "no volume".
std::vector<VolumeConfig> KIVOVolumesLoad();

// The volume whose path is `path` or holds it ("/volume1/x" -> "/volume1"),
// into *out. False, *out untouched, when no configured volume holds it.
[[nodiscard]] bool KIVOVolumeFind(const std::string& path, VolumeConfig* out);
