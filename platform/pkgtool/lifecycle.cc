#include "pkgtool/lifecycle.h"

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <limits.h>
#include <set>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "pkgtool/btrfs_subvolume.h"
#include "pkgtool/registry.h"
#include "pkgtool/script_runner.h"
#include "pkgtool/upgrade_recovery.h"
#include "storage/volumes.h"

#include <stdlib.h>

namespace {

bool IsEnvKey(const std::string& key) {
  if (key.empty() || key.size() > 64) return false;
  for (char c : key) {
    if (!isalnum(static_cast<unsigned char>(c)) && c != '_') return false;
  }
  return true;
}

std::string ProgressPath(const std::string& id) {
  return KIVORootPath("/run/kivo/pkgtool/progress/") + id;
}

std::string RealPath(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? buf : "";
}

}  // namespace

std::map<std::string, std::string> PMSScriptEnv(const PackageInfo& info, const std::string& record,
                                                const std::string& operation, const Operation& op,
                                                const Json::Value& wizard_values,
                                                const std::string& old_version) {
  std::map<std::string, std::string> env = {
      {"PATH", "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin"},
      {"LANG", "C.UTF-8"},
      {"HOME", record + "/var"},
      {"KIVO_ROOT", KIVOSysRoot().empty() ? "/" : KIVOSysRoot()},
      {"KIVO_PKG_NAME", info.getId()},
      {"KIVO_PKG_VERSION", info.getVersion()},
      {"KIVO_PKG_OPERATION", operation},
      {"KIVO_PKG_DEST", record + "/target"},
      {"KIVO_PKG_VAR", record + "/var"},
      {"KIVO_WORKER_MSG", op.worker_message_path()},
  };
  if (!old_version.empty()) env["KIVO_PKG_OLD_VERSION"] = old_version;
  if (wizard_values.isObject()) {
    std::string path = op.worker_message_path() + ".wizard.json";
    // Scripts read the answers from the file (one member a line, as it has
    // always been written); without it they only get the variables below,
    // and the log says so.
    if (KIVOWriteFileAtomic(path, KIVOWriteJson(wizard_values, "\t"), SyncToDisk::No, 0600)) {
      env["KIVO_WIZARD_VALUES"] = path;
    } else {
      op.Log("cannot write the wizard answers for the scripts");
    }
    for (const std::string& key : wizard_values.getMemberNames()) {
      const Json::Value& v = wizard_values[key];
      if (IsEnvKey(key) && (v.isString() || v.isNumeric() || v.isBool())) {
        env["KIVO_WIZARD_" + key] = v.asString();
      }
    }
  }
  return env;
}

bool PMSRunPackageScript(const std::string& record, const std::string& name, const std::string& arg,
                         const std::map<std::string, std::string>& env, const Operation& op) {
  int status =
      PMSRunScript(record + "/scripts/" + name, arg, env, PMSScriptTimeout(), op.log_path());
  if (status == SCRIPT_MISSING || status == 0) return true;
  if (status == SCRIPT_TIMED_OUT) {
    op.Log(name + " did not finish within " + std::to_string(PMSScriptTimeout()) +
           " seconds and was killed");
  } else if (status == SCRIPT_NOT_RUN) {
    op.Log(name + " could not be run");
  } else {
    op.Log(name + " failed with status " + std::to_string(status));
  }
  return false;
}

void PMSSetProgress(const std::string& id, double progress) {
  std::string path = ProgressPath(id);
  if (KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()) != 0) return;
  char text[32];
  snprintf(text, sizeof(text), "%.4f\n", progress);
  // Progress is a hint for readers (see the header): a failed write keeps the
  // last figure and must not fail the install.
  static_cast<void>(KIVOWriteFileAtomic(path, text, SyncToDisk::No));
}

void PMSClearProgress(const std::string& id) { unlink(ProgressPath(id).c_str()); }

void PMSFaultPoint(const char* step) {
  const char* fault = getenv("KIVO_PKGTOOL_FAULT");
  if (fault && strcmp(fault, step) == 0) kill(getpid(), SIGKILL);
}

bool PMSRemoveTree(const std::string& owner, const std::string& path) {
  if (!PMSIsStrictlyInside(path, owner)) return false;
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return errno == ENOENT;
  // A Btrfs data folder or its copy goes in one step; rm empties one that
  // holds a subvolume of its own and removes the emptied subvolumes.
  if (PMSIsSubvolume(path) && PMSDestroySubvolume(path)) return true;
  return KLIBCExec("/bin/rm", "-rf", "--", path.c_str(), nullptr) == 0;
}

std::string PMSVolumeFolderHolding(const std::string& path, const char* kind) {
  for (const VolumeConfig& volume : KIVOVolumesLoad()) {
    std::string folder = KIVORootPath(volume.path + "/" + kind);
    if (PMSIsStrictlyInside(path, folder)) return folder;
  }
  return "";
}

std::set<std::string> PMSListDir(const std::string& dir) {
  std::set<std::string> names;
  DIR* d = opendir(dir.c_str());
  if (!d) return names;
  while (struct dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.insert(e->d_name);
  }
  closedir(d);
  return names;
}

bool PMSRecoverLeftovers() {
  // Upgrades first: a version an interrupted upgrade replaced is published
  // by no one, yet must come back; one that cannot come back yet keeps its
  // record and payload for the next try.
  std::set<std::string> live_records, live_targets;
  bool all_removed = PMSRecoverUpgrades(&live_records);
  for (const std::string& name : live_records) {
    std::string target = RealPath(PackageRegistry::RecordsDir() + "/" + name + "/target");
    if (!target.empty()) live_targets.insert(target);
  }
  for (const std::string& id : PackageRegistry::List()) {
    std::string record = PackageRegistry::PublishedRecord(id);
    if (record.compare(0, 9, ".records/") == 0) live_records.insert(record.substr(9));
    std::string target = RealPath(PackageRegistry::RecordDir(id) + "/target");
    if (!target.empty()) live_targets.insert(target);
  }
  std::string records = PackageRegistry::RecordsDir();
  for (const std::string& name : PMSListDir(records)) {
    if (!live_records.count(name)) all_removed &= PMSRemoveTree(records, records + "/" + name);
  }
  for (const std::string& name : PMSListDir(PackageRegistry::Dir())) {
    std::string path = PackageRegistry::Dir() + "/" + name;
    bool half_published = name.compare(0, 9, ".publish-") == 0;
    bool dangling = name[0] != '.' && !PackageRegistry::PublishedRecord(name).empty() &&
                    !PackageRegistry::IsInstalled(name);
    if ((half_published || dangling) && unlink(path.c_str()) != 0) all_removed = false;
  }
  for (const VolumeConfig& volume : KIVOVolumesLoad()) {
    std::string store = KIVORootPath(volume.path + "/@appstore");
    for (const std::string& name : PMSListDir(store)) {
      std::string path = RealPath(store + "/" + name);
      if (!path.empty() && !live_targets.count(path)) {
        all_removed &= PMSRemoveTree(store, store + "/" + name);
      }
    }
  }
  return all_removed;
}
