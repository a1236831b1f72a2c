// The package tool's rollback to a kept version and the removal of kept
// versions (rollback.h, revisions.h).

#include "pkgtool/rollback.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <sys/stat.h>
#include <unistd.h>

#include "pkgtool/lifecycle.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/revisions.h"

namespace {

bool Exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::string Because(const std::string& what) { return what + " (" + strerror(errno) + ")"; }

std::string Link(const std::string& path) {
  char buf[4096];
  ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : "";
}

// The versions of `id` that earlier upgrades kept (PMSListRevisions) when
// *result is PKG_OK; none otherwise. When none is kept, a refused rollback
// or removal says so in the log of `op` and *result is PKG_ERR_NO_REVISION.
std::vector<PMSRevision> KeptRevisions(const std::string& id, const Operation& op, int* result) {
  if (*result != PKG_OK) return {};
  std::vector<PMSRevision> revisions = PMSListRevisions(id);
  if (revisions.empty()) {
    op.Log("no earlier version of " + id + " is kept to roll back to" +
           (PMSKeepRevisionsSetting() == 0
                ? " (keep_revisions is 0 in /etc/kivo/pkgtool.conf: upgrades keep none)"
                : "") +
           "; nothing was changed");
    *result = PKG_ERR_NO_REVISION;
  }
  return revisions;
}

// Runs the published version's start-stop-status with `action`.
bool Control(const std::string& id, const PackageInfo& info, const std::string& action,
             const Operation& op) {
  const std::string record = PackageRegistry::RecordDir(id);
  auto env = PMSScriptEnv(info, record, action, op, Json::Value());
  return PMSRunPackageScript(record, "start-stop-status", action, env, op);
}

// Steps 1 to 5 of rollback.h for `id`, published as `info`, to `r`. *ran
// says whether the package ran before. The result code; the log says what
// happened in words.
int RollBackTo(const std::string& id, const PackageInfo& info, const PMSRevision& r,
               const Operation& op, bool* ran) {
  const DataSnapshot s = r.snapshot();
  const std::string published = PackageRegistry::PublishedRecordPath(id);
  if (published.empty() || Link(published + "/var") != s.data_dir()) {
    op.Log("the data folder of the installed " + id + " is not the one " + r.version +
           "'s copy was taken from; nothing was changed");
    return PKG_ERR_INTERNAL;
  }
  *ran = PMSIsRunning(id, info);
  if (*ran && !Control(id, info, "stop", op) && PMSIsRunning(id, info)) {
    op.Log(info.getVersion() + " did not stop; nothing was changed");
    return PKG_ERR_SCRIPT_FAILED;
  }
  const std::string now = info.getVersion();
  if (!PMSRenameDurably(r.copy(), s.Named(kPMSRollbackSuffix))) {
    op.Log(Because("cannot begin the rollback") + "; nothing was changed");
    return PKG_ERR_INTERNAL;
  }
  PMSFaultPoint("rollback_begun");
  std::string error;
  switch (PMSFinishRollback(s, &error)) {
    case RollbackState::kDone:
      return PKG_OK;
    case RollbackState::kUntouched:
      // Nothing moved: the revision is made a revision again.
      if (PMSRenameDurably(s.Named(kPMSRollbackSuffix), r.copy())) {
        op.Log("the rollback failed (" + error + "); nothing was changed");
        return PKG_ERR_INTERNAL;
      }
      break;
    case RollbackState::kDataKept:
    case RollbackState::kNoDataBack:
      break;
  }
  op.Log("the rollback to " + r.version + " stopped half way (" + error + "): " + id +
         " is stopped, and the next package operation finishes the rollback");
  return PKG_ERR_SCRIPT_FAILED;
}

}  // namespace

RollbackState PMSFinishRollback(const DataSnapshot& s, std::string* error) {
  const std::string back = s.Named(kPMSRollbackSuffix), data = s.data_dir();
  const std::string target = ".records/" + s.record();
  if (!s.IsValid() || !Exists(back) ||
      !Exists(PackageRegistry::RecordsDir() + "/" + s.record() + "/INFO")) {
    *error = "the version to roll back to, or its data, is gone";
    return RollbackState::kUntouched;
  }
  const std::string published = PackageRegistry::PublishedRecord(s.id());
  if (Exists(data)) {
    // Step 3: the data the published version wrote is kept as its own.
    if (published == target || !PackageRegistry::IsRecordNameOf(s.id(), published)) {
      *error = "the installed version is not the one the rollback leaves";
      return RollbackState::kUntouched;
    }
    const DataSnapshot leaving(s.appdata(), s.id(), published.substr(9));
    if (!PMSKeepAsRevision(leaving, data)) {
      *error = Because("cannot keep the data of the installed version");
      return RollbackState::kUntouched;
    }
    PMSFaultPoint("rollback_data_kept");
  }
  if (published != target) {
    if (!PackageRegistry::Publish(s.id(), target)) {
      *error = Because("cannot publish the kept version's record");
      return RollbackState::kDataKept;
    }
    PMSFaultPoint("rollback_published");
  }
  if (!PMSRenameDurably(back, data)) {
    *error = Because("cannot move the kept data into place");
    return RollbackState::kNoDataBack;
  }
  return RollbackState::kDone;
}

bool PackageManager::rollback(const std::string& id, const std::string& user) {
  Operation op("rollback", PMSIsValidPackageId(id) ? id : "invalid");
  PackageInfo info;
  int result = LockAndLoad(id, &info);
  const std::vector<PMSRevision> revisions = KeptRevisions(id, op, &result);
  bool ran = false;
  if (result == PKG_OK) result = RollBackTo(id, info, revisions.front(), op, &ran);
  if (result == PKG_OK) {
    const PMSRevision& r = revisions.front();
    const std::string record = PackageRegistry::RecordDir(id);
    op.Log(id + " " + info.getVersion() + " was rolled back by " + user + " to " + r.version +
           " with its data as it was when it was replaced (" + PMSReplacedText(r.replaced) + "); " +
           info.getVersion() + " and its data are kept: a rollback returns to them");
    // A rollback keeps at least the version it leaves, whatever the
    // setting, so that it can be undone.
    if (!PMSTrimRevisions(id, std::max(1, PMSKeepRevisionsSetting()))) {
      op.Log("some earlier versions beyond keep_revisions stay until the next operation");
    }
    PackageInfo back;
    if (!RecordEnabled(record, ran, op)) result = PKG_ERR_INTERNAL;
    if (ran && PMSLoadInstalled(id, &back) && !Control(id, back, "start", op)) {
      op.Log(r.version + " and its data are back, but " + r.version + " did not start");
      result = PKG_ERR_SCRIPT_FAILED;
    }
    PMSFaultPoint("rollback_done");
  }
  UnLock();
  setOutcome(result, op.log_path(), op.WorkerMessages(), {}, Json::Value(Json::arrayValue));
  return result == PKG_OK;
}

bool PackageManager::dropRevisions(const std::string& id) {
  Operation op("drop-revision", PMSIsValidPackageId(id) ? id : "invalid");
  PackageInfo info;
  int result = LockAndLoad(id, &info);
  const std::vector<PMSRevision> revisions = KeptRevisions(id, op, &result);
  for (size_t i = 0; result == PKG_OK && i < revisions.size(); ++i) {
    const PMSRevision& r = revisions[i];
    const uint64_t bytes = PMSRevisionBytes(r);
    if (PMSDropRevision(r)) {
      op.Log("dropped " + id + " " + r.version + " and its data, " + std::to_string(bytes) +
             " bytes");
    } else {
      op.Log("cannot drop all of " + id + " " + r.version +
             "; the next package operation removes what stays");
      result = PKG_ERR_INTERNAL;
    }
  }
  UnLock();
  setOutcome(result, op.log_path(), op.WorkerMessages(), {}, Json::Value(Json::arrayValue));
  return result == PKG_OK;
}
