#include "pkgtool/pms.h"

#include <cstdio>
#include <fcntl.h>
#include <limits.h>
#include <sstream>
#include <sys/file.h>
#include <sys/random.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"
#include "storage/os_version.h"
#include "storage/volume_space.h"
#include "storage/volumes.h"

#include <stdlib.h>
#include <time.h>

namespace {

constexpr char kDefVolKey[] = "pkg_def_volume";
// A volume with less free room than this counts as full: packages and their
// downloads must never take its last bytes.
constexpr int64_t kReserveBytes = 1 << 20;

// A volume's own problem as a platform error number, 0 when it can be used.
int VolumeProblem(const VolumeConfig& v, int64_t needed) {
  if (v.status == "crashed") return KLIBC_ERR_VOLUME_CRASHED;
  if (!v.usable()) return KLIBC_ERR_VOLUME_NOT_FOUND;
  int64_t free_bytes = KIVOVolumeFreeBytes(v);
  if (free_bytes < 0) return KLIBC_ERR_VOLUME_NOT_FOUND;
  return free_bytes < needed + kReserveBytes ? KLIBC_ERR_NO_SPACE : 0;
}

// The volume named exactly `path`, when it exists and can take packages;
// otherwise false with the platform error number set.
bool FindUsableVolume(const std::string& path, VolumeConfig* v) {
  if (!KIVOVolumeFind(path, v) || v->path != path) {
    KLIBCErrSet(KLIBC_ERR_VOLUME_NOT_FOUND);
    return false;
  }
  int problem = VolumeProblem(*v, 0);
  if (problem) KLIBCErrSet(problem);
  return problem == 0;
}

bool MakeFreshDir(const std::string& parent, const std::string& prefix, std::string* out) {
  if (KIVOFSMkdirP(parent.c_str(), 0755) != 0) return false;
  std::string pattern = parent + "/" + prefix + "XXXXXX";
  if (!mkdtemp(&pattern[0])) return false;
  *out = pattern;
  return true;
}

void ParseOSLimit(const std::string& text, int& major, int& minor, int& build) {
  major = minor = build = 0;
  if (!KIVOParseOSVersion(text, &major, &minor, &build)) major = minor = build = 0;
}

}  // namespace

int PMSCheckPackage(const std::string& id) { return PackageRegistry::IsInstalled(id) ? 1 : 0; }

std::string PMSGetPackageTarget(const PackageInfo& info) {
  if (!info.getTarget().empty()) return info.getTarget();
  char real[PATH_MAX];
  if (!PMSIsValidPackageId(info.getId())) return "";
  return realpath((PackageRegistry::RecordDir(info.getId()) + "/target").c_str(), real) ? real : "";
}

bool PMSGetPackageVol(const std::string& id, std::string& volume) {
  KeyValueMap info;
  if (!PackageRegistry::ReadInfo(id, &info) || info["install_volume"].empty()) return false;
  volume = info["install_volume"];
  return true;
}

bool PMSGetPackageDefVol(std::string& path) {
  char buf[256];
  path.clear();
  if (KLIBCFileGetKeyValue(KIVORootPath("/etc/kivoinfo.conf").c_str(), kDefVolKey, buf, sizeof(buf),
                           0) <= 0) {
    return true;
  }
  VolumeConfig v;
  if (!FindUsableVolume(buf, &v)) return false;
  path = v.path;
  return true;
}

bool PMSSavePackageDefVolPath(const std::string& path) {
  VolumeConfig v;
  if (!path.empty() && !FindUsableVolume(path, &v)) return false;
  return KLIBCINFOSetKeyValue(kDefVolKey, path.c_str()) == 0;
}

bool PMSGetTmpDir(int64_t size, std::string& dir) {
  bool full = false;
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    int problem = VolumeProblem(v, size);
    full |= problem == KLIBC_ERR_NO_SPACE;
    if (problem == 0 && MakeFreshDir(KIVORootPath(v.path + "/@tmp"), "kivo-pkg-", &dir))
      return true;
  }
  if (full) {
    KLIBCErrSet(KLIBC_ERR_NO_SPACE);
    return false;
  }
  if (MakeFreshDir(KIVORootPath("/tmp"), "kivo-pkg-", &dir)) return true;
  KLIBCErrSet(KLIBC_ERR_NO_TMP_DIR);
  return false;
}

bool PMSCreateDownloadTmpDir(const std::string& volume, const std::string& name, int64_t size,
                             std::string& folder) {
  if (!PMSIsValidPackageId(name)) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    if (!volume.empty() && v.path != volume) continue;
    int problem = VolumeProblem(v, size);
    if (problem == 0 &&
        MakeFreshDir(KIVORootPath(v.path + "/@tmp"), "download-" + name + "-", &folder)) {
      return true;
    }
    if (problem) KLIBCErrSet(problem);
  }
  if (KLIBCErrGet() == 0) KLIBCErrSet(KLIBC_ERR_NO_TMP_DIR);
  return false;
}

bool PMSGetCtlUninstall(const PackageInfo& info) { return info.getBool("ctl_uninstall"); }

void PMSGetOSMinVer(const PackageInfo& info, int& major, int& minor, int& build) {
  ParseOSLimit(info.get("os_min_ver"), major, minor, build);
}

void PMSGetOSMaxVer(const PackageInfo& info, int& major, int& minor, int& build) {
  ParseOSLimit(info.get("os_max_ver"), major, minor, build);
}

int PMSThirdPartyCheckLimit(const std::string& id, const std::string& version) {
  return PMSThirdPartyLimits().Restricts(id, version) ? 1 : 0;
}

PMSThirdPartyLimits::PMSThirdPartyLimits() {
  std::string text;
  if (!KIVOReadFile(KIVORootPath("/usr/kivo/etc/packages/restricted"), &text, 1 << 20)) return;
  std::istringstream in(text);
  std::string rid, rversion;
  while (in >> rid >> rversion) restricted_.emplace(rid, rversion);
}

bool PMSThirdPartyLimits::Restricts(const std::string& id, const std::string& version) const {
  return !restricted_.empty() && restricted_.count({id, version}) != 0;
}

double PMSGetProgress(const std::string& id) {
  std::string text;
  if (!PMSIsValidPackageId(id) ||
      !KIVOReadFile(KIVORootPath("/run/kivo/pkgtool/progress/") + id, &text, 64)) {
    return -1.0;
  }
  return std::atof(text.c_str());
}

std::string PMSGetInstallImage(const std::string& id, int size) {
  if (!PMSIsValidPackageId(id)) return "";
  std::string path = PackageRegistry::RecordDir(id) +
                     (size >= 256 ? "/PACKAGE_ICON_256.PNG" : "/PACKAGE_ICON.PNG");
  return access(path.c_str(), R_OK) == 0 ? path : "";
}

int PMSLockFile(const std::string& path, int seconds) {
  if (KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()) != 0) return -1;
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (fd < 0) return -1;
  struct timespec start;
  clock_gettime(CLOCK_MONOTONIC, &start);
  while (flock(fd, LOCK_EX | LOCK_NB) != 0) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    long long waited_ms =
        (now.tv_sec - start.tv_sec) * 1000LL + (now.tv_nsec - start.tv_nsec) / 1000000;
    if (waited_ms >= seconds * 1000LL) {
      close(fd);
      KLIBCErrSet(KLIBC_ERR_LOCK);
      return -1;
    }
    usleep(20000);
  }
  return fd;
}

void PMSUnlockFile(int fd) {
  if (fd >= 0) close(fd);
}

int PMSToolSetting(const std::string& key, int def, int min) {
  KeyValueMap conf;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/pkgtool.conf"), &conf)) return def;
  const std::string& text = conf[key];
  char* end = nullptr;
  long value = std::strtol(text.c_str(), &end, 10);
  if (text.empty() || *end != '\0' || value < min || value > INT_MAX) return def;
  return static_cast<int>(value);
}

int PMSLockWaitSeconds() { return PMSToolSetting("lock_wait", 3, 0); }
