#include "tools/kivoctl/root_setup.h"

#include <sys/stat.h>

#include "klibc/atomic_file.h"

namespace {

const char* const kFolders[] = {
    "etc/kivo",                // platform configuration
    "usr/kivo/etc/packages",   // the feed list and package center files
    "usr/kivo/bin",            // platform scripts
    "var/packages",            // the installed-package registry
    "var/log/packages",        // package operation logs
    "run/kivo/sessions",       // signed-in sessions
    "tmp",                     // temporary files of uploads and downloads
    "volume1",                 // the first data volume
    "usr/kivo/www",            // the web server's document root
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
     "update_channel=\"stable\"\n"
     "pkg_trust_level=\"0\"\n"
     "enable_pkg_autoupdate=\"no\"\n"
     "enable_pkg_autoupdate_all=\"no\"\n"
     "pkg_autoupdate_all=\"no\"\n",
     0644},
    {"etc/kivo/webapi.conf",
     "# Web API host settings.\n"
     "session_idle_timeout=\"1800\"\n"
     "session_max_age=\"86400\"\n",
     0644},
    {"usr/kivo/etc/packages/feeds", "[]\n", 0644},
};

}  // namespace

bool KIVOCreateSystemRoot(const std::string& dir, std::string* error) {
  if (dir.empty()) return (*error = "no root folder given"), false;
  for (const char* folder : kFolders) {
    std::string path = dir + "/" + folder;
    unsigned mode = std::string(folder) == "run/kivo/sessions" ? 0700 : 0755;
    if (KIVOFSMkdirP(path.c_str(), mode) != 0) return (*error = "cannot create " + path), false;
  }
  chmod((dir + "/tmp").c_str(), 01777);
  for (const DefaultFile& f : kFiles) {
    std::string path = dir + "/" + f.path;
    if (KLIBCFileExist(path.c_str())) continue;
    if (!KIVOWriteFileAtomic(path, f.content, SyncToDisk::No, f.mode)) {
      return (*error = "cannot write " + path), false;
    }
  }
  return true;
}
