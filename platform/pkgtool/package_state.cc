#include "pkgtool/package_state.h"

#include <cstdlib>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "pkgtool/registry.h"
#include "pkgtool/script_runner.h"

#include <stdlib.h>

namespace {

unsigned WizardMask(const std::string& record) {
  unsigned mask = 0;
  for (const PMSWizardFile& w : kPMSWizardFiles) {
    if (access((record + "/" + w.member).c_str(), F_OK) == 0) mask |= w.op;
  }
  return mask;
}

}  // namespace

bool PMSLoadInstalled(const std::string& id, PackageInfo* info) {
  KeyValueMap kv;
  if (!PackageRegistry::IsInstalled(id) || !PackageRegistry::ReadInfo(id, &kv)) return false;
  std::string record = PackageRegistry::RecordDir(id);
  *info = PackageInfo(kv);
  // The installer writes `target` as an absolute link to the payload folder:
  // one readlink, where realpath would read every component of the path.
  char target[PATH_MAX];
  ssize_t n = readlink((record + "/target").c_str(), target, sizeof(target) - 1);
  struct stat st;
  if (n > 0 && target[0] == '/') {
    target[n] = '\0';
    if (stat(target, &st) == 0 && S_ISDIR(st.st_mode)) info->setTarget(target);
  }
  info->setWizardMask(WizardMask(record));
  std::string license;
  if (KIVOReadFile(record + "/LICENSE", &license, 1 << 20)) info->setLicense(license);
  return true;
}

bool PMSIsRunning(const std::string& id, const PackageInfo& info) {
  if (!info.isStartable()) return false;
  std::string record = PackageRegistry::RecordDir(id);
  const std::string pidfile = info.get("pidfile");
  if (PMSIsContainedRelativePath(pidfile)) {
    std::string text;
    if (!KIVOReadFile(record + "/var/" + pidfile, &text, 64)) return false;
    return KLIBCProcAlive(static_cast<pid_t>(std::atol(text.c_str()))) == 1;
  }
  std::map<std::string, std::string> env = {{"PATH", "/usr/sbin:/usr/bin:/sbin:/bin"},
                                            {"KIVO_PKG_NAME", id},
                                            {"KIVO_PKG_DEST", record + "/target"},
                                            {"KIVO_PKG_VAR", record + "/var"}};
  return PMSRunScript(record + "/scripts/start-stop-status", "status", env, 10, "") == 0;
}

std::vector<std::string> PMSInstalledDependents(const std::string& id) {
  std::vector<std::string> dependents;
  for (const std::string& other : PackageRegistry::List()) {
    KeyValueMap kv;
    if (other == id || !PackageRegistry::ReadInfo(other, &kv)) continue;
    for (const PackageBasicInfo& dep : PackageInfo(kv).getDependencies()) {
      if (dep.getName() == id) dependents.push_back(other);
    }
  }
  return dependents;
}
