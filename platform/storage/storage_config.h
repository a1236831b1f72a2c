// The appliance's storage, device and system services as configured under
// the system root. They stand in for the storage manager and the service
// manager, which are not part of the package center:
//
//   /etc/kivo/volumes.json  [{"path": "/volume1", "status": "normal",
//                             "cap_bytes": 0, "brick": false}, ...]
//   /etc/kivo/device.conf   os_version="7.2-0064" arch="x86_64" kind="nas"
//   /etc/kivo/services.conf pgsql="running" web="running" ssh="stopped"
//
// Free space is the real statvfs figure of the volume's folder, capped at
// "cap_bytes" when that is above 0 (so that a full volume can be produced on
// purpose).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include <json/value.h>

struct VolumeConfig {
  std::string path;    // "/volume1", as the appliance names it
  std::string status;  // "normal", "degraded", "crashed", ...
  uint64_t cap_bytes = 0;
  bool brick = false;  // serves as a cluster file system brick

  bool usable() const { return status == "normal" || status == "degraded"; }
};

// Every configured volume, in file order. Empty when the file is missing
// or unreadable.
std::vector<VolumeConfig> KIVOVolumesLoad();
// The volume whose path is `path` or holds it ("/volume1/x" -> "/volume1").
[[nodiscard]] bool KIVOVolumeFind(const std::string& path, VolumeConfig* out);
// Free bytes of the volume (statvfs of its folder under the root, capped).
// -1 when the folder cannot be measured.
int64_t KIVOVolumeFreeBytes(const VolumeConfig& volume);

struct DeviceInfo {
  std::string os_version = "7.2-0064";
  std::string arch = "x86_64";
  std::string kind = "nas";  // "nas", or "tinbox" for the single-volume device
};
DeviceInfo KIVODeviceLoad();

// True when the system service `name` is running (services.conf says "running").
bool KIVOServiceRunning(const std::string& name);

// "7.2-0064" -> 7, 2, 64. False when malformed.
[[nodiscard]] bool KIVOParseOSVersion(const std::string& text, int* major, int* minor, int* build);
// <0, 0, >0 comparing two OS versions as (major, minor, build).
int KIVOCompareOSVersion(const std::string& a, const std::string& b);

// The volume part of a real path under the system root
// ("<root>/volume1/@appstore/x" -> "/volume1") into `volume`. 0 on success,
// -1 when the path lies on no configured volume.
[[nodiscard]] int VolumePathParseEx(const std::string& path, std::string& volume);
// 1 when the volume holding the real path `path` serves as a cluster file
// system brick, 0 when not, -1 when the path lies on no volume.
int KIVOVolumeIsUsedByGlusterFs(const std::string& path);

// True on the single-volume device kind ("tinbox" in device.conf).
bool KLIBCIsTinbox();

// The mount facts of a volume path ("/volume1").
struct KIVOMountVolInfo {
  int available = 0;        // 1 when the volume is mounted and usable
  uint64_t free_bytes = 0;  // free space (statvfs, capped)
};
// 0 and `info` filled, or -1 when `path` is no configured volume.
[[nodiscard]] int KIVOMountVolInfoGet(const char* path, KIVOMountVolInfo* info);

// The temporary folder of the shared folder that holds the real path
// `path` ("<root>/volume1/<share>/x"): the volume's "@tmp" folder, where
// uploads and downloads are kept. Written to `buf` (NUL-terminated); the
// length, or -1 when `path` lies on no volume or `buf` is too small.
[[nodiscard]] int KIVOShareTmpPathGet(const char* path, char* buf, int size);

namespace KIVO {
namespace PXS {
namespace STORAGE_WEBUTILS {

// The volume list the web desktop shows for installs.
class Volume {
 public:
  // `flags` selects the volumes; every kind lists the usable ones.
  explicit Volume(int flags) : flags_(flags) {}
  // out["volumes"] = [{"volume_path", "status", "size_free_byte",
  // "size_total_byte", "is_brick"}], out["volume_count"]. False when the
  // storage configuration cannot be read.
  [[nodiscard]] bool VolumeListGet(Json::Value& out, bool with_unusable);

 private:
  // Every kind of listing is the same so far; the flags are kept for when
  // one differs.
  [[maybe_unused]] int flags_;
};

}  // namespace STORAGE_WEBUTILS
}  // namespace PXS
}  // namespace KIVO
