#include "storage/volume_list.h"

#include <algorithm>
#include <string>
#include <sys/stat.h>

#include "storage/volume_space.h"
#include "storage/volumes.h"

namespace {

// A byte count as the list writes it; an unmeasured figure lists as 0.
std::string ByteText(int64_t bytes) { return std::to_string(std::max<int64_t>(0, bytes)); }

Json::Value VolumeEntry(const VolumeConfig& v) {
  Json::Value entry(Json::objectValue);
  entry["volume_path"] = v.path;
  entry["status"] = v.status;
  entry["size_free_byte"] = ByteText(KIVOVolumeFreeBytes(v));
  entry["size_total_byte"] = ByteText(KIVOVolumeTotalBytes(v));
  entry["is_brick"] = v.brick;
  return entry;
}

}  // namespace

namespace KIVO {
namespace PXS {
namespace STORAGE_WEBUTILS {

bool Volume::VolumeListGet(Json::Value& out, bool with_unusable) {
  struct stat st;
  if (stat(KIVOVolumesFile().c_str(), &st) != 0) return false;
  Json::Value list(Json::arrayValue);
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    if (v.usable() || with_unusable) list.append(VolumeEntry(v));
  }
  out["volume_count"] = list.size();
  out["volumes"] = list;
  return true;
}

}  // namespace STORAGE_WEBUTILS
}  // namespace PXS
}  // namespace KIVO
