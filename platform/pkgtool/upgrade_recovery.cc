#include "pkgtool/upgrade_recovery.h"

#include <cerrno>
#include <cstring>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "klibc/sysroot.h"
#include "pkgtool/data_snapshot.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_state.h"
#include "pkgtool/registry.h"
#include "pkgtool/revisions.h"
#include "pkgtool/rollback.h"
#include "storage/volumes.h"

namespace {

bool IsFolder(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool EndsWith(const std::string& text, const std::string& end) {
  return text.size() > end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

// One package's entries in its copies' folder, sorted by what they are.
struct PackageCopies {
  std::set<std::string> whole;      // records R with a copy <R>
  std::set<std::string> restores;   // records R with a <R>.replaced: a restore under way
  std::set<std::string> kept;       // records R with a <R>.kept: kept revisions (revisions.h)
  std::set<std::string> rollbacks;  // records R with a <R>.back: a rollback under way
  std::vector<std::string> junk;    // incomplete or discarded copies, anything else
};

PackageCopies SortCopies(const std::string& id, const std::string& folder) {
  PackageCopies copies;
  const std::pair<std::string, std::set<std::string>*> kinds[] = {
      {".replaced", &copies.restores},
      {kPMSKeptSuffix, &copies.kept},
      {kPMSRollbackSuffix, &copies.rollbacks}};
  for (const std::string& name : PMSListDir(folder)) {
    // Only a folder can be a copy: a symlink put here must never be moved
    // into a data folder's place.
    const bool folder_entry = IsFolder(folder + "/" + name);
    std::string record = name;
    std::set<std::string>* into = &copies.whole;
    for (const auto& kind : kinds) {
      if (EndsWith(name, kind.first)) {
        record = name.substr(0, name.size() - kind.first.size());
        into = kind.second;
        break;
      }
    }
    const bool named = !EndsWith(record, ".copying") && !EndsWith(record, ".discard") &&
                       PackageRegistry::IsRecordNameOf(id, ".records/" + record);
    if (!folder_entry || !named) {
      copies.junk.push_back(name);
    } else {
      into->insert(record);
    }
  }
  return copies;
}

// The version to put back: one whose restore is under way, else the
// published one's, else the first. The others are stale.
std::string ChooseRecord(const PackageCopies& copies, const std::string& published) {
  if (!copies.restores.empty()) return *copies.restores.begin();
  if (copies.whole.count(published.substr(published.rfind('/') + 1))) {
    return published.substr(published.rfind('/') + 1);
  }
  return copies.whole.empty() ? "" : *copies.whole.begin();
}

// Stops the published version of `id` when it runs: the data it uses is
// about to be replaced. True when it does not run afterwards.
bool StopPublished(const std::string& id) {
  PackageInfo info;
  if (!PMSLoadInstalled(id, &info) || !PMSIsRunning(id, info)) return true;
  Operation op("recover", id);
  const std::string record = PackageRegistry::RecordDir(id);
  auto env = PMSScriptEnv(info, record, "stop", op, Json::Value());
  const bool stopped = PMSRunPackageScript(record, "start-stop-status", "stop", env, op);
  unlink(op.log_path().c_str());
  return stopped || !PMSIsRunning(id, info);
}

// Removes the copies folder's entries other than those of `record`.
bool RemoveOthers(const std::string& folder, const PackageCopies& copies,
                  const std::string& record) {
  bool ok = true;
  // A rollback of a package that is no longer installed has nothing to
  // finish.
  for (const std::string& r : copies.rollbacks) {
    ok &= PMSRemoveTree(folder, folder + "/" + r + kPMSRollbackSuffix);
  }
  for (const std::string& name : copies.junk) ok &= PMSRemoveTree(folder, folder + "/" + name);
  for (const std::string& r : copies.whole) {
    if (r != record) ok &= PMSRemoveTree(folder, folder + "/" + r);
  }
  for (const std::string& r : copies.restores) {
    if (r != record) ok &= PMSRemoveTree(folder, folder + "/" + r + ".replaced");
  }
  return ok;
}

// Puts back the version of `record` with its data. False when it stays to
// be done: the record must then stay too.
bool Restore(const DataSnapshot& s) {
  if (!StopPublished(s.id())) {
    syslog(LOG_ERR, "pkgtool: %s: an interrupted upgrade cannot be undone yet: it does not stop",
           s.id().c_str());
    return false;
  }
  std::string error;
  RestoreState state = PMSRestoreSnapshot(s, &error);
  if (state == RestoreState::kRestored) {
    syslog(LOG_NOTICE, "pkgtool: %s: an interrupted upgrade was undone; %s is back with its data",
           s.id().c_str(), s.record().c_str());
    return true;
  }
  // A copy whose version is gone cannot come back with its code, and the
  // package stays whole as it is published: the copy is of no use.
  if (state == RestoreState::kNoCopy && !IsFolder(s.Named(".replaced"))) {
    return PMSRemoveTree(s.folder(), s.copy());
  }
  syslog(LOG_ERR, "pkgtool: %s: an interrupted upgrade cannot be undone yet: %s", s.id().c_str(),
         error.c_str());
  return false;
}

// Finishes the rollback under way in `copies` (the first; any other is
// junk). False when it stays to be done: then every record a copy names
// must stay.
bool FinishRollback(const std::string& appdata, const std::string& id, const std::string& folder,
                    const PackageCopies& copies) {
  const std::string record = *copies.rollbacks.begin();
  bool ok = true;
  for (const std::string& r : copies.rollbacks) {
    if (r != record) ok &= PMSRemoveTree(folder, folder + "/" + r + kPMSRollbackSuffix);
  }
  if (!StopPublished(id)) {
    syslog(LOG_ERR, "pkgtool: %s: an interrupted rollback cannot be finished yet: it does not stop",
           id.c_str());
    return false;
  }
  std::string error;
  if (PMSFinishRollback(DataSnapshot(appdata, id, record), &error) != RollbackState::kDone) {
    syslog(LOG_ERR, "pkgtool: %s: an interrupted rollback cannot be finished yet: %s", id.c_str(),
           error.c_str());
    return false;
  }
  syslog(LOG_NOTICE, "pkgtool: %s: an interrupted rollback was finished; %s is back with its data",
         id.c_str(), record.c_str());
  return ok;
}

// An upgrade to the published version that was confirmed (its record names
// the version R it replaced, PMSUpgradedFrom) while its copy still has the
// name <R> of an upgrade under way: the tool stopped between the commit and
// the rename, or the rename never reached the disk. Finishes what the
// upgrade would have done: <R> becomes <R>.kept, or is dropped when no
// revision is kept. A restore under way goes on instead (it began because
// the commit failed). False when the rename stays to be done: then <R> must
// stay as it is, never be put back.
bool FinishConfirmedUpgrade(const std::string& appdata, const std::string& id,
                            const std::string& published, PackageCopies* copies) {
  const std::string from = PMSUpgradedFrom(id, published);
  if (from.empty() || !copies->restores.empty() || copies->whole.count(from) == 0) return true;
  const DataSnapshot s(appdata, id, from);
  const bool keep = PMSKeepRevisionsSetting() > 0;
  if (keep ? !PMSRenameDurably(s.copy(), s.Named(kPMSKeptSuffix)) : !PMSDiscardSnapshot(s)) {
    syslog(LOG_ERR, "pkgtool: %s: the confirmed upgrade away from %s cannot be finished yet: %s",
           id.c_str(), from.c_str(), strerror(errno));
    return false;
  }
  copies->whole.erase(from);
  if (keep) copies->kept.insert(from);
  syslog(LOG_NOTICE, "pkgtool: %s: the confirmed upgrade away from %s was finished", id.c_str(),
         from.c_str());
  return true;
}

// Keeps the kept revisions that are whole (their records go into `kept`)
// and removes the others; a package that is not installed keeps none.
bool SortOutRevisions(const std::string& appdata, const std::string& id, const std::string& folder,
                      const std::set<std::string>& revisions, std::set<std::string>* kept) {
  bool ok = true;
  for (const std::string& r : revisions) {
    PMSRevision revision;
    if (!PackageRegistry::PublishedRecord(id).empty() &&
        PMSReadRevision(appdata, id, r, &revision)) {
      if (kept) kept->insert(r);
    } else {
      ok &= PMSRemoveTree(folder, folder + "/" + r + kPMSKeptSuffix);
    }
  }
  return ok;
}

bool RecoverPackage(const std::string& appdata, const std::string& id,
                    std::set<std::string>* kept) {
  const std::string folder = PMSSnapshotsDir(appdata) + "/" + id;
  if (!IsFolder(folder)) return PMSRemoveTree(PMSSnapshotsDir(appdata), folder);
  PackageCopies copies = SortCopies(id, folder);
  bool ok = true;
  if (!copies.rollbacks.empty() && !PackageRegistry::PublishedRecord(id).empty()) {
    if (!FinishRollback(appdata, id, folder, copies)) {
      // Half way, the data of a version may lie in any of the copies: all
      // stay, with the records they name, for the next try.
      if (kept) {
        for (const auto* names : {&copies.rollbacks, &copies.kept, &copies.whole}) {
          kept->insert(names->begin(), names->end());
        }
      }
      return false;
    }
    copies = SortCopies(id, folder);
  }
  const std::string published = PackageRegistry::PublishedRecord(id);
  if (!published.empty() && !FinishConfirmedUpgrade(appdata, id, published, &copies)) {
    if (kept) {
      for (const auto* names : {&copies.kept, &copies.whole})
        kept->insert(names->begin(), names->end());
    }
    return false;
  }
  const std::string record = published.empty() ? "" : ChooseRecord(copies, published);
  ok &= RemoveOthers(folder, copies, record);
  if (!record.empty() && !Restore(DataSnapshot(appdata, id, record))) {
    if (kept) kept->insert(record);
    ok = false;
  }
  ok &= SortOutRevisions(appdata, id, folder, copies.kept, kept);
  rmdir(folder.c_str());  // only when nothing stays in it
  return ok;
}

}  // namespace

bool PMSRecoverUpgrades(std::set<std::string>* kept) {
  bool ok = true;
  for (const VolumeConfig& volume : KIVOVolumesLoad()) {
    const std::string appdata = KIVORootPath(volume.path + "/@appdata");
    const std::string dir = PMSSnapshotsDir(appdata);
    struct stat st;
    if (lstat(dir.c_str(), &st) != 0) continue;
    // Anything but a folder of our own making is junk, and is removed
    // without being followed.
    if (!S_ISDIR(st.st_mode)) {
      ok &= PMSRemoveTree(appdata, dir);
      continue;
    }
    for (const std::string& name : PMSListDir(dir)) {
      ok &= PMSIsValidPackageId(name) ? RecoverPackage(appdata, name, kept)
                                      : PMSRemoveTree(dir, dir + "/" + name);
    }
    rmdir(dir.c_str());  // only when nothing stays in it
  }
  return ok;
}
