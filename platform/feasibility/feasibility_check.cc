#include "feasibility/feasibility_check.h"

#include <algorithm>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "klibc/last_error.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "pkgtool/data_snapshot.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "storage/volume_space.h"
#include "storage/volumes.h"
#include "taskmgr/task.h"
#include "taskmgr/task_names.h"

namespace {

constexpr int64_t kLowSpaceBytes = 1LL << 30;

std::vector<std::string> SplitIds(const std::string& text, bool* valid) {
  std::vector<std::string> ids;
  std::istringstream in(text);
  *valid = true;
  for (std::string id; std::getline(in, id, ',');) {
    if (!PMSIsValidPackageId(id)) *valid = false;
    ids.push_back(id);
  }
  if (ids.empty()) *valid = false;
  return ids;
}

// True when another process holds the package tool's lock.
bool ToolBusy() {
  int fd = PMSLockFile(KIVORootPath("/run/kivo/pkgtool/lock"), 0);
  PMSUnlockFile(fd);
  return fd < 0;
}

// True when a task of a running job (a live "pid") concerns `id`.
bool OperationRunning(NVX::TaskMgr& mgr, const std::string& id) {
  for (const char* prefix : {KIVOPackageTasks::kDownloadPrefix, KIVOPackageTasks::kStartStopPrefix,
                             KIVOPackageTasks::kUninstallPrefix}) {
    std::unique_ptr<NVX::Task> task(GetTaskWithTaskMgr(mgr, prefix + id));
    if (!task) continue;
    Json::Value data = task->getProperty("data");
    if (data["pid"].isInt() && KLIBCProcAlive(data["pid"].asInt()) == 1 && !task->isFinished()) {
      return true;
    }
  }
  return false;
}

// The name the reasons give a package: its display name when it is
// installed (the reasons are shown to people as they stand), else its id.
std::string NameOf(const std::string& id) {
  PackageInfo info;
  return PMSLoadInstalled(id, &info) ? info.getDisplayName() : id;
}

std::vector<std::string> RunningDependents(const std::string& id) {
  std::vector<std::string> running;
  for (const std::string& other : PMSInstalledDependents(id)) {
    PackageInfo info;
    if (PMSLoadInstalled(other, &info) && PMSIsRunning(other, info)) running.push_back(other);
  }
  return running;
}

class Checker {
 public:
  Checker(int type, PKLIBSZLIST* reasons) : type_(type), reasons_(reasons) {}

  void Hard(const std::string& id, NVX::TaskMgr& mgr);
  void Soft(const std::string& id);
  int count() const { return count_; }
  void Add(const std::string& reason) {
    if (KLIBCSzListPush(reasons_, reason.c_str()) == 0) ++count_;
  }

 private:
  void InstallVolume(const std::string& id, bool hard);
  void DataCopyRoom(const std::string& id);

  int type_;
  PKLIBSZLIST* reasons_;
  int count_ = 0;
};

void Checker::InstallVolume(const std::string& id, bool hard) {
  std::string path;
  // Neither an installed version's volume nor a usable default leaves the
  // path empty: the first usable volume is taken below.
  if (!PMSGetPackageVol(id, path) && !PMSGetPackageDefVol(path)) path.clear();
  VolumeConfig volume;
  bool found = !path.empty() && KIVOVolumeFind(path, &volume);
  if (!found) {
    for (const VolumeConfig& v : KIVOVolumesLoad()) {
      if (v.usable()) {
        volume = v;
        found = true;
        break;
      }
    }
  }
  if (hard && !found) Add("No volume can take packages.");
  if (hard && found && volume.status == "crashed") Add("Volume " + volume.path + " is crashed.");
  if (!hard && found && volume.usable() && KIVOVolumeFreeBytes(volume) < kLowSpaceBytes) {
    Add("Volume " + volume.path + " has less than 1 GiB of free space.");
  }
}

std::string MiB(uint64_t bytes) { return std::to_string((bytes + (1 << 20) - 1) >> 20) + " MiB"; }

// An upgrade of an installed package first copies its data, unless the
// package needs no copy (data_snapshot.h). Where the volume has no room for
// that copy, the administrator may still upgrade without one: the advice
// says what that gives up. The room the new version's files take is not
// known here; the upgrade itself checks both together.
void Checker::DataCopyRoom(const std::string& id) {
  PackageInfo installed;
  std::string path;
  VolumeConfig volume;
  if (!PMSLoadInstalled(id, &installed) || !installed.getBool(kPMSDataCopyKey, true) ||
      !PMSGetPackageVol(id, path) || !KIVOVolumeFind(path, &volume)) {
    return;
  }
  const std::string appdata = KIVORootPath(volume.path + "/@appdata");
  uint64_t room = 0;
  std::string problem;
  if (!PMSDataCopyRoom(appdata, appdata + "/" + id, &room, &problem))
    return;  // the upgrade says why
  const int64_t free = std::max<int64_t>(KIVOVolumeFreeBytes(volume), 0);
  if (room <= static_cast<uint64_t>(free)) return;
  Add("Volume " + volume.path + " has no room for a safety copy of the data of " + NameOf(id) +
      " (" + MiB(room) + " needed, " + MiB(free) +
      " free). The upgrade can go on without one, but if it then fails, the data it changed "
      "cannot be brought back.");
}

void Checker::Hard(const std::string& id, NVX::TaskMgr& mgr) {
  if (OperationRunning(mgr, id)) Add(NameOf(id) + " is being installed or changed right now.");
  bool installed = PackageRegistry::IsInstalled(id);
  if (type_ == KIVO_FEASIBILITY_INSTALL) {
    InstallVolume(id, true);
    return;
  }
  if (!installed) {
    Add(id + " is not installed.");
    return;
  }
  if (type_ == KIVO_FEASIBILITY_UNINSTALL) {
    for (const std::string& other : PMSInstalledDependents(id))
      Add(NameOf(other) + " needs " + NameOf(id) + ".");
  } else {
    for (const std::string& other : RunningDependents(id))
      Add(NameOf(other) + " runs and needs " + NameOf(id) + ".");
  }
}

void Checker::Soft(const std::string& id) {
  if (type_ == KIVO_FEASIBILITY_INSTALL) {
    InstallVolume(id, false);
    if (PackageRegistry::IsInstalled(id)) DataCopyRoom(id);
  } else if (type_ == KIVO_FEASIBILITY_UNINSTALL && PackageRegistry::IsInstalled(id)) {
    Add("Removing " + NameOf(id) + " deletes the data it keeps.");
  } else if (type_ == KIVO_FEASIBILITY_STOP) {
    for (const std::string& other : PMSInstalledDependents(id)) {
      Add(NameOf(other) + " cannot start while " + NameOf(id) + " is stopped.");
    }
  }
}

}  // namespace

int KIVOFeasibilityCheck(int type, int check_type, PKLIBSZLIST* reasons, const char* packages,
                         int flags) {
  bool valid = false;
  std::vector<std::string> ids = SplitIds(packages ? packages : "", &valid);
  bool known_type = type == KIVO_FEASIBILITY_INSTALL || type == KIVO_FEASIBILITY_UNINSTALL ||
                    type == KIVO_FEASIBILITY_STOP;
  bool known_check = check_type == KIVO_FEASIBILITY_HARD || check_type == KIVO_FEASIBILITY_SOFT;
  if (!reasons || !*reasons || !known_type || !known_check || !valid) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  PackageManager pm;
  if (!pm.init()) {
    KLIBCErrSet(KLIBC_ERR_FILE_READ);
    return -1;
  }
  Checker checker(type, reasons);
  if (check_type == KIVO_FEASIBILITY_HARD && ToolBusy()) {
    checker.Add("The package center is busy with another package operation.");
  }
  NVX::TaskMgr mgr(KIVOPackageTasks::kTaskOwner);
  for (const std::string& id : ids) {
    if (check_type == KIVO_FEASIBILITY_HARD) {
      checker.Hard(id, mgr);
    } else {
      checker.Soft(id);
    }
  }
  return checker.count();
}
