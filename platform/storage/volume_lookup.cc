#include "storage/volume_lookup.h"

#include <cstring>

#include "klibc/sysroot.h"
#include "storage/volume_space.h"
#include "storage/volumes.h"

namespace {

// "<root>/volume1/x" -> the configured volume holding it.
bool VolumeOfRealPath(const std::string& path, VolumeConfig* out) {
  std::string root = KIVOSysRoot();
  if (path.compare(0, root.size(), root) != 0) return false;
  std::string rest = path.substr(root.size());
  return !rest.empty() && rest[0] == '/' && KIVOVolumeFind(rest, out);
}

}  // namespace

int VolumePathParseEx(const std::string& path, std::string& volume) {
  VolumeConfig v;
  if (!VolumeOfRealPath(path, &v)) return -1;
  volume = v.path;
  return 0;
}

int KIVOVolumeIsUsedByGlusterFs(const std::string& path) {
  VolumeConfig v;
  if (!VolumeOfRealPath(path, &v)) return -1;
  return v.brick ? 1 : 0;
}

int KIVOMountVolInfoGet(const char* path, KIVOMountVolInfo* info) {
  VolumeConfig v;
  if (!path || !info || !KIVOVolumeFind(path, &v) || v.path != path) return -1;
  int64_t free_bytes = KIVOVolumeFreeBytes(v);
  info->available = v.usable() && free_bytes >= 0 ? 1 : 0;
  info->free_bytes = free_bytes > 0 ? static_cast<uint64_t>(free_bytes) : 0;
  return 0;
}

int KIVOShareTmpPathGet(const char* path, char* buf, int size) {
  VolumeConfig v;
  if (!path || !buf || size <= 0 || !VolumeOfRealPath(path, &v)) return -1;
  std::string tmp = KIVORootPath(v.path + "/@tmp");
  if (static_cast<int>(tmp.size()) >= size) return -1;
  memcpy(buf, tmp.c_str(), tmp.size() + 1);
  return static_cast<int>(tmp.size());
}
