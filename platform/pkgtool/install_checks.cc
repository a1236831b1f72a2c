#include "pkgtool/install_checks.h"

#include <cerrno>
#include <cstdlib>
#include <sys/socket.h>
#include <unistd.h>

#include "klibc/last_error.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "storage/device_info.h"
#include "storage/os_version.h"
#include "storage/volume_space.h"

#include <netinet/in.h>

namespace {

bool PortInUse(int port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_ANY);
  int one = 1;
  setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
  bool in_use =
      bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 && errno == EADDRINUSE;
  close(fd);
  return in_use;
}

bool ArchFits(const std::string& wanted, const std::string& arch) {
  if (wanted.empty() || wanted == "noarch") return true;
  size_t start = 0;
  while (start <= wanted.size()) {
    size_t end = wanted.find_first_of(" ,", start);
    if (end == std::string::npos) end = wanted.size();
    if (wanted.substr(start, end - start) == arch) return true;
    start = end + 1;
  }
  return false;
}

int Refuse(int code, const std::string& text, std::string* message) {
  *message = text;
  return code;
}

// The package's memory and process limits against this appliance's bounds:
// above them the package is refused, never silently lowered, so that its
// author's claim and what it gets never differ at install.
int CheckLimits(const PackageInfo& info, std::string* message) {
  PackageLimits limits;
  const std::string above = PackageLimitsCheck({{"memory_limit_mb", info.get("memory_limit_mb")},
                                                {"process_limit", info.get("process_limit")}},
                                               PackageLimitSettingsLoad(), &limits);
  return above.empty() ? PKG_OK : Refuse(PKG_ERR_LIMIT_ABOVE_BOUND, above, message);
}

}  // namespace

int PMSCheckPackageFits(const PackageInfo& info, int arch_code, std::string* message,
                        Json::Value* details) {
  DeviceInfo device = KIVODeviceLoad();
  if (!ArchFits(info.get("arch"), device.arch)) {
    return Refuse(arch_code, "made for " + info.get("arch") + ", this device is " + device.arch,
                  message);
  }
  if (!info.get("os_min_ver").empty() &&
      KIVOCompareOSVersion(device.os_version, info.get("os_min_ver")) < 0) {
    return Refuse(PKG_ERR_OS_TOO_OLD, "needs OS " + info.get("os_min_ver") + " or later", message);
  }
  if (!info.get("os_max_ver").empty() &&
      KIVOCompareOSVersion(device.os_version, info.get("os_max_ver")) > 0) {
    return Refuse(PKG_ERR_OS_TOO_NEW, "runs on OS up to " + info.get("os_max_ver"), message);
  }
  if (int code = CheckLimits(info, message); code != PKG_OK) return code;
  PackageManager pm;
  std::string conflicts;
  if (pm.arePackagesConflict(PackageBasicInfo(info.getId(), info.getVersion()), info.getConflicts(),
                             conflicts, nullptr)) {
    (*details)["instPackageList"] = conflicts;
    return Refuse(PKG_ERR_CONFLICT, "conflicts with " + conflicts, message);
  }
  std::set<std::string> stopped = pm.checkServiceStarted(PMSServiceSet(info.getServiceString()));
  if (!stopped.empty()) {
    Json::Value names(Json::arrayValue);
    for (const std::string& s : stopped) names.append(s);
    (*details)["serviceNoStarted"] = names;
    return Refuse(PKG_ERR_SERVICE_NOT_RUNNING, "needs running services", message);
  }
  Json::Value missing(Json::arrayValue);
  std::string not_started;
  if (!pm.arePackagesInstallAndStart(info.getDependencies(), missing, not_started, nullptr)) {
    (*details)["packages"] = missing;
    (*details)["unStartPkgList"] = not_started;
    (*details)["deppkg"] = info.getDependencies().toString();
    return Refuse(PKG_ERR_DEPENDENCY, "needs packages that are missing or stopped", message);
  }
  bool upgrade = PackageRegistry::IsInstalled(info.getId());
  if (info.getBool("checkport", true) && info.getAdminPort() && !upgrade &&
      PortInUse(info.getAdminPort())) {
    return Refuse(PKG_ERR_PORT_IN_USE, "port " + std::to_string(info.getAdminPort()) + " is in use",
                  message);
  }
  return PKG_OK;
}

uint64_t PMSNeededBytes(const PackageInfo& info, uint64_t payload_size) {
  uint64_t kib = std::strtoull(info.get("extractsize").c_str(), nullptr, 10);
  return kib > 0 ? kib * 1024 : payload_size * 2;
}

int PMSChooseVolume(const PackageInfo& info, const std::string& requested, uint64_t needed_bytes,
                    VolumeConfig* out, std::string* message) {
  std::string wanted = requested;
  // An installed version keeps its volume; a new package has none yet.
  if (wanted.empty() && !PMSGetPackageVol(info.getId(), wanted)) wanted.clear();
  if (wanted.empty() && !PMSGetPackageDefVol(wanted)) {
    // The default volume is set but cannot take the package; one that is
    // gone altogether leaves the choice to the first usable volume.
    if (KLIBCErrGet() == KLIBC_ERR_VOLUME_CRASHED)
      return Refuse(PKG_ERR_VOLUME_CRASHED, "the default volume is crashed", message);
    if (KLIBCErrGet() == KLIBC_ERR_NO_SPACE)
      return Refuse(PKG_ERR_NO_SPACE, "the default volume is full", message);
  }
  bool found = false;
  if (!wanted.empty()) {
    found = KIVOVolumeFind(wanted, out);
  } else {
    // The first usable volume; failing that, a crashed one, so the answer
    // says why there is nowhere to install.
    for (const VolumeConfig& v : KIVOVolumesLoad()) {
      if (!found || (v.usable() && !out->usable())) {
        *out = v;
        found = true;
      }
    }
  }
  if (!found)
    return Refuse(PKG_ERR_NO_VOLUME, "no usable volume" + (wanted.empty() ? "" : ": " + wanted),
                  message);
  if (out->status == "crashed")
    return Refuse(PKG_ERR_VOLUME_CRASHED, out->path + " is crashed", message);
  if (!out->usable()) return Refuse(PKG_ERR_NO_VOLUME, out->path + " is " + out->status, message);
  int64_t free_bytes = KIVOVolumeFreeBytes(*out);
  if (free_bytes < 0 || static_cast<uint64_t>(free_bytes) < needed_bytes) {
    return Refuse(PKG_ERR_NO_SPACE, "not enough space on " + out->path, message);
  }
  return PKG_OK;
}
