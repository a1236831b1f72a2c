#include "storage/volumes.h"

#include <mutex>
#include <sys/stat.h>

#include <json/value.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/sysroot.h"

namespace {

// A volume path that names a folder of the appliance and nothing above it.
bool IsVolumePath(const std::string& path) {
  return !path.empty() && path[0] == '/' && path.find("..") == std::string::npos;
}

std::vector<VolumeConfig> ParseVolumes(const std::string& path) {
  std::vector<VolumeConfig> volumes;
  Json::Value list;
  std::string text;
  if (!KIVOReadFile(path, &text, 1 << 20) || !KIVOParseJson(text, &list) || !list.isArray()) {
    return volumes;
  }
  for (const Json::Value& v : list) {
    if (!v.isObject() || !v["path"].isString() || !IsVolumePath(v["path"].asString())) continue;
    VolumeConfig volume;
    volume.path = v["path"].asString();
    volume.status = v["status"].isString() ? v["status"].asString() : "normal";
    volume.cap_bytes = v["cap_bytes"].isUInt64() ? v["cap_bytes"].asUInt64() : 0;
    volume.brick = v["brick"].isBool() && v["brick"].asBool();
    volumes.push_back(volume);
  }
  return volumes;
}

bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_ino == b.st_ino && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec && a.st_size == b.st_size;
}

}  // namespace

std::string KIVOVolumesFile() { return KIVORootPath("/etc/kivo/volumes.json"); }

std::vector<VolumeConfig> KIVOVolumesLoad() {
  // A list of thousands of packages asks for the volume of each; parse the
  // file again only when it has changed (a rename gives it a new inode).
  static std::mutex mutex;
  static struct {
    std::string path;
    struct stat st;
    std::vector<VolumeConfig> volumes;
  } cache;
  std::string path = KIVOVolumesFile();
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return {};
  std::lock_guard<std::mutex> lock(mutex);
  if (cache.path != path || !SameFile(cache.st, st)) {
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
