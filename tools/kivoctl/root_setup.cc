#include "tools/kivoctl/root_setup.h"

#include <sys/stat.h>

#include "klibc/atomic_file.h"
#include "tools/kivoctl/codesign_install.h"
#include "tools/kivoctl/fallback_icon.h"

namespace {

const char* const kFolders[] = {
    "etc/kivo",                                          // platform configuration
    "usr/kivo/etc/packages",                             // the feed list and package center files
    "usr/kivo/bin",                                      // platform scripts
    "var/packages",                                      // the installed-package registry
    "var/log/packages",                                  // package operation logs
    "run/kivo/sessions",                                 // signed-in sessions
    "tmp",                                               // temporary files of uploads and downloads
    "volume1",                                           // the first data volume
    "usr/kivo/www",                                      // the web server's document root
    "run/kivo/pkgtool",                                  // the package tool's lock and progress
    "usr/kivo/kivoman/webman/modules/PkgManApp/images",  // the package center's icons
};

struct DefaultFile {
  const char* path;
  const char* content;
  unsigned mode;
};

const DefaultFile kFiles[] = {
    {"etc/passwd", "root:x:0:0::/root:/bin/sh\n", 0644},
    {"etc/shadow", "root:*:0:0:99999:7:::\n", 0600},
    {"etc/group", "root:x:0:\nusers:x:100:\nadministrators:x:101:\n", 0644},
    {"etc/kivoinfo.conf",
     "# Package center settings of this appliance.\n"
     "package_update_channel=\"stable\"\n"
     "pkg_source_trust_level=\"0\"\n"
     "upgrade_pkg_email_notification=\"no\"\n"
     "upgrade_pkg_nvx_notification=\"yes\"\n"
     "enable_pkg_autoupdate_all=\"no\"\n",
     0644},
    {"etc/kivo/volumes.json",
     "[\n  {\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 0, \"brick\": "
     "false}\n]\n",
     0644},
    {"etc/kivo/device.conf",
     "# What this appliance is.\n"
     "os_version=\"7.2-0064\"\n"
     "arch=\"x86_64\"\n"
     "kind=\"nas\"\n",
     0644},
    {"etc/kivo/services.conf",
     "# System services and their state.\n"
     "pgsql=\"running\"\n"
     "web=\"running\"\n"
     "ssh=\"running\"\n"
     "smb=\"running\"\n",
     0644},
    {"etc/kivo/pkgtool.conf",
     "# Package tool settings (docs/package-tool.md), here with their defaults.\n"
     "# Seconds a package script may run.\n"
     "script_timeout=\"120\"\n"
     "# The health gate of an upgrade: seconds to report running, and for scripts/health.\n"
     "health_grace_seconds=\"30\"\n"
     "health_check_timeout_seconds=\"10\"\n"
     "# Earlier versions an upgrade keeps, with their data, for a rollback.\n"
     "keep_revisions=\"1\"\n"
     "# The accounts packages run as.\n"
     "package_uid_first=\"30000\"\n"
     "package_uid_last=\"39999\"\n"
     "# Memory (MiB) and process limits of a package, and the most one may ask for.\n"
     "memory_limit_mb_default=\"512\"\n"
     "memory_limit_mb_max=\"4096\"\n"
     "process_limit_default=\"256\"\n"
     "process_limit_max=\"4096\"\n",
     0644},
    {"etc/kivo/webapi.conf",
     "# Web API host settings.\n"
     "session_idle_timeout=\"1800\"\n"
     "session_max_age=\"86400\"\n",
     0644},
    {"etc/kivo/pkgserver.conf",
     "# Package servers (docs/package-server.md). kivoctl server-config changes them.\n"
     "vendor_url=\"https://packages.kivo.invalid/catalogue.json\"\n"
     "company_info_url=\"https://www.kivo.invalid/company-info\"\n",
     0644},
    {"usr/kivo/etc/packages/feeds", "[]\n", 0644},
};

// The package center's own icons, shown for packages without one. The
// server icon method asks for its large one under a doubled extension.
const struct {
  const char* name;
  int size;
} kFallbackIcons[] = {
    {"package_center_72.png", 72},
    {"package_center_256.png", 256},
    {"package_center_256.png.png", 256},
};

bool WriteFallbackIcons(const std::string& dir, std::string* error) {
  for (const auto& icon : kFallbackIcons) {
    std::string path = dir + "/usr/kivo/kivoman/webman/modules/PkgManApp/images/" + icon.name;
    if (KLIBCFileExist(path.c_str())) continue;
    if (!KIVOWriteFallbackIcon(path, icon.size)) return (*error = "cannot write " + path), false;
  }
  return true;
}

}  // namespace

bool KIVOCreateSystemRoot(const std::string& dir, std::string* error) {
  if (dir.empty()) return (*error = "no root folder given"), false;
  for (const char* folder : kFolders) {
    std::string path = dir + "/" + folder;
    unsigned mode = std::string(folder) == "run/kivo/sessions" ? 0700 : 0755;
    if (KIVOFSMkdirP(path.c_str(), mode) != 0) return (*error = "cannot create " + path), false;
  }
  chmod((dir + "/tmp").c_str(), 01777);
  // GnuPG insists on a private home for the appliance keyring.
  std::string keyring = dir + "/usr/kivo/etc/packages/gnupg";
  if (KIVOFSMkdirP(keyring.c_str(), 0700) != 0) return (*error = "cannot create " + keyring), false;
  if (!KIVOInstallCodesignScript(dir, error)) return false;
  for (const DefaultFile& f : kFiles) {
    std::string path = dir + "/" + f.path;
    if (KLIBCFileExist(path.c_str())) continue;
    if (!KIVOWriteFileAtomic(path, f.content, SyncToDisk::No, f.mode)) {
      return (*error = "cannot write " + path), false;
    }
  }
  return WriteFallbackIcons(dir, error);
}
