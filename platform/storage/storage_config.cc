#include "storage/storage_config.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "webapi/webapi_util.h"

namespace {

std::vector<VolumeConfig> ParseVolumes(const std::string& path) {
  std::vector<VolumeConfig> volumes;
  Json::Value list;
  std::string text;
  if (!KIVOReadFile(path, &text, 1 << 20) || !WebAPIUtil::ParseJson(text, list) ||
      !list.isArray()) {
    return volumes;
  }
  for (const Json::Value& v : list) {
    if (!v.isObject() || !v["path"].isString()) continue;
    VolumeConfig volume;
    volume.path = v["path"].asString();
    if (volume.path.empty() || volume.path[0] != '/' ||
        volume.path.find("..") != std::string::npos) {
      continue;
    }
    volume.status = v["status"].isString() ? v["status"].asString() : "normal";
    volume.cap_bytes = v["cap_bytes"].isUInt64() ? v["cap_bytes"].asUInt64() : 0;
    volume.brick = v["brick"].isBool() && v["brick"].asBool();
    volumes.push_back(volume);
  }
  return volumes;
}

}  // namespace

std::vector<VolumeConfig> KIVOVolumesLoad() {
  // A list of thousands of packages asks for the volume of each; parse the
  // file again only when it has changed (a rename gives it a new inode).
  static std::mutex mutex;
  static struct {
    std::string path;
    struct stat st;
    std::vector<VolumeConfig> volumes;
  } cache;
  std::string path = KIVORootPath("/etc/kivo/volumes.json");
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return {};
  std::lock_guard<std::mutex> lock(mutex);
  if (cache.path != path || cache.st.st_ino != st.st_ino ||
      cache.st.st_mtim.tv_nsec != st.st_mtim.tv_nsec || cache.st.st_mtime != st.st_mtime ||
      cache.st.st_size != st.st_size) {
    cache.volumes = ParseVolumes(path);
    cache.path = path;
    cache.st = st;
  }
  return cache.volumes;
}

bool KIVOVolumeFind(const std::string& path, VolumeConfig* out) {
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    if (path == v.path || path.compare(0, v.path.size() + 1, v.path + "/") == 0) {
      *out = v;
      return true;
    }
  }
  return false;
}

int64_t KIVOVolumeFreeBytes(const VolumeConfig& volume) {
  struct statvfs st;
  if (statvfs(KIVORootPath(volume.path).c_str(), &st) != 0) return -1;
  uint64_t free_bytes = static_cast<uint64_t>(st.f_bavail) * st.f_frsize;
  if (volume.cap_bytes > 0 && volume.cap_bytes < free_bytes) free_bytes = volume.cap_bytes;
  return static_cast<int64_t>(free_bytes);
}

DeviceInfo KIVODeviceLoad() {
  DeviceInfo device;
  KeyValueMap conf;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/device.conf"), &conf)) return device;
  if (!conf["os_version"].empty()) device.os_version = conf["os_version"];
  if (!conf["arch"].empty()) device.arch = conf["arch"];
  if (!conf["kind"].empty()) device.kind = conf["kind"];
  return device;
}

bool KIVOServiceRunning(const std::string& name) {
  KeyValueMap conf;
  return KIVOKeyValueLoad(KIVORootPath("/etc/kivo/services.conf"), &conf) &&
         conf[name] == "running";
}

bool KIVOParseOSVersion(const std::string& text, int* major, int* minor, int* build) {
  char tail;
  return sscanf(text.c_str(), "%d.%d-%d%c", major, minor, build, &tail) == 3;
}

int KIVOCompareOSVersion(const std::string& a, const std::string& b) {
  // A malformed version compares as 0.0-0, below every real one.
  int a1 = 0, a2 = 0, a3 = 0, b1 = 0, b2 = 0, b3 = 0;
  if (!KIVOParseOSVersion(a, &a1, &a2, &a3)) a1 = a2 = a3 = 0;
  if (!KIVOParseOSVersion(b, &b1, &b2, &b3)) b1 = b2 = b3 = 0;
  if (a1 != b1) return a1 < b1 ? -1 : 1;
  if (a2 != b2) return a2 < b2 ? -1 : 1;
  if (a3 != b3) return a3 < b3 ? -1 : 1;
  return 0;
}

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

bool KLIBCIsTinbox() { return KIVODeviceLoad().kind == "tinbox"; }

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

namespace KIVO {
namespace PXS {
namespace STORAGE_WEBUTILS {

bool Volume::VolumeListGet(Json::Value& out, bool with_unusable) {
  struct stat st;
  if (stat(KIVORootPath("/etc/kivo/volumes.json").c_str(), &st) != 0) return false;
  Json::Value list(Json::arrayValue);
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    if (!v.usable() && !with_unusable) continue;
    struct statvfs fs;
    Json::Value entry(Json::objectValue);
    entry["volume_path"] = v.path;
    entry["status"] = v.status;
    entry["size_free_byte"] = std::to_string(std::max<int64_t>(0, KIVOVolumeFreeBytes(v)));
    uint64_t total = statvfs(KIVORootPath(v.path).c_str(), &fs) == 0
                         ? static_cast<uint64_t>(fs.f_blocks) * fs.f_frsize
                         : 0;
    if (v.cap_bytes > 0 && v.cap_bytes < total) total = v.cap_bytes;
    entry["size_total_byte"] = std::to_string(total);
    entry["is_brick"] = v.brick;
    list.append(entry);
  }
  out["volume_count"] = list.size();
  out["volumes"] = list;
  return true;
}

}  // namespace STORAGE_WEBUTILS
}  // namespace PXS
}  // namespace KIVO
