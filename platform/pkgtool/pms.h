// The package tool's free functions: where packages live, volumes and
// temporary space, progress, locks.
#pragma once

#include <cstdint>
#include <set>
#include <string>

#include "pkgtool/package_info.h"

// Nonzero when `id` is installed.
int PMSCheckPackage(const std::string& id);
// The folder the package's files are installed in ("" when unknown).
std::string PMSGetPackageTarget(const PackageInfo& info);
// The volume the installed package `id` lives on ("/volume1"). False when
// it is not installed.
[[nodiscard]] bool PMSGetPackageVol(const std::string& id, std::string& volume);

// The default install volume ("pkg_def_volume" of /etc/kivoinfo.conf).
// True with "" when none is set; false when the one set is missing
// (last error 0x0600), crashed (0x8400) or full (0x2900).
[[nodiscard]] bool PMSGetPackageDefVol(std::string& path);
// Stores `path` as the default volume ("" clears it). False when the volume
// is unknown (0x0600), crashed (0x8400), full (0x2900) or the settings file
// cannot be written.
[[nodiscard]] bool PMSSavePackageDefVolPath(const std::string& path);

// A temporary folder with room for `size` bytes: "@tmp/kivo-pkg" of the
// first usable volume with room, else the root's "/tmp". False with last
// error 0x2900 (no room anywhere) or 0xDD00 (no temporary folder at all).
[[nodiscard]] bool PMSGetTmpDir(int64_t size, std::string& dir);
// Creates a fresh download folder for `name` on `volume` (or any volume with
// room for `size` bytes when empty). False with the last error set.
[[nodiscard]] bool PMSCreateDownloadTmpDir(const std::string& volume, const std::string& name,
                                           int64_t size, std::string& folder);

// INFO "ctl_uninstall": the package controls its own uninstall.
bool PMSGetCtlUninstall(const PackageInfo& info);
// The package's OS limits ("os_min_ver", "os_max_ver") as numbers; all 0
// when not set.
void PMSGetOSMinVer(const PackageInfo& info, int& major, int& minor, int& build);
void PMSGetOSMaxVer(const PackageInfo& info, int& major, int& minor, int& build);
// Nonzero when `id` at `version` may not be offered as an upgrade
// ("/usr/kivo/etc/packages/restricted": lines "id version").
int PMSThirdPartyCheckLimit(const std::string& id, const std::string& version);
// The same list read once, for a caller that checks many entries.
class PMSThirdPartyLimits {
 public:
  PMSThirdPartyLimits();
  bool Restricts(const std::string& id, const std::string& version) const;

 private:
  std::set<std::pair<std::string, std::string>> restricted_;
};
// The install progress of `id` (0.0 to 1.0), -1.0 when none is running.
double PMSGetProgress(const std::string& id);
// The path of the package's icon (size 72 or 256), "" when it has none.
std::string PMSGetInstallImage(const std::string& id, int size);

// An exclusive advisory lock on `path`, waiting at most `seconds` (0: one
// try). The descriptor to pass to PMSUnlockFile, or -1 (last error
// KLIBC_ERR_LOCK) when it could not be taken.
[[nodiscard]] int PMSLockFile(const std::string& path, int seconds);
void PMSUnlockFile(int fd);

// A whole-number setting of the tool's settings file /etc/kivo/pkgtool.conf:
// `def` when it is missing, not a number, or below `min`.
int PMSToolSetting(const std::string& key, int def, int min);
// How long a changing operation waits for the tool's lock before it answers
// 275: "lock_wait" of /etc/kivo/pkgtool.conf (seconds, 0 = no wait), 3 by
// default.
int PMSLockWaitSeconds();
