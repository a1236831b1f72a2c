#include "pkgtool/data_snapshot.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

#include "klibc/atomic_file.h"
#include "pkgtool/btrfs_subvolume.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/registry.h"

namespace {

bool Exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

// Makes the renames in folder `dir` survive a power cut: they are the
// upgrade's journal.
void SyncDir(const std::string& dir) {
  int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return;
  fsync(fd);
  close(fd);
}

std::string Parent(const std::string& path) { return path.substr(0, path.rfind('/')); }

// Removes the copies' folders of `s` that hold nothing any more.
void RemoveEmptyFolders(const DataSnapshot& s) {
  rmdir(s.folder().c_str());
  rmdir(PMSSnapshotsDir(s.appdata()).c_str());
}

std::string Because(const std::string& what) { return what + " (" + strerror(errno) + ")"; }

// Moves D aside (unless an interrupted restore did) and the copy into its
// place. On failure D is put back where it can be.
RestoreState PutCopyBack(const DataSnapshot& s, std::string* error) {
  const std::string data = s.data_dir(), aside = s.Named(".replaced");
  const bool aside_before = Exists(aside);
  if (!aside_before && Exists(data) && !PMSRenameDurably(data, aside)) {
    *error = Because("cannot move the data folder aside");
    return RestoreState::kUntouched;
  }
  PMSFaultPoint("restore_half_done");
  if (PMSRenameDurably(s.copy(), data)) return RestoreState::kRestored;
  *error = Because("cannot move the copy of the data into place");
  if (!Exists(aside)) return RestoreState::kUntouched;  // there was no data folder to move
  return PMSRenameDurably(aside, data) ? RestoreState::kUntouched : RestoreState::kDataAside;
}

bool PublishAgain(const DataSnapshot& s, std::string* error) {
  const std::string record = ".records/" + s.record();
  if (PackageRegistry::PublishedRecord(s.id()) == record) return true;
  if (PackageRegistry::Publish(s.id(), record)) return true;
  *error = Because("cannot publish the previous version's record again");
  return false;
}

// The copy of a data folder that is a Btrfs subvolume: a snapshot, in one
// step whatever it holds.
TreeCopyResult Snapshot(const std::string& data, const std::string& to, std::string* error) {
  if (PMSSnapshotSubvolume(data, to)) return TreeCopyResult::kCopied;
  const bool full = errno == ENOSPC || errno == EDQUOT;
  *error = Because("cannot take a snapshot of the data folder");
  return full ? TreeCopyResult::kNoSpace : TreeCopyResult::kFailed;
}

}  // namespace

bool PMSConfirmUpgrade(const DataSnapshot& s, const std::string& new_record) {
  if (!s.IsValid()) {
    errno = EINVAL;
    return false;
  }
  if (KIVOWriteFileAtomic(new_record + "/" + kPMSUpgradedFromMember, s.record() + "\n"))
    return true;
  if (errno == 0) errno = EIO;
  return false;
}

std::string PMSUpgradedFrom(const std::string& id, const std::string& record) {
  std::string text;
  if (!PackageRegistry::IsRecordNameOf(id, record) ||
      !KIVOReadFile(PackageRegistry::Dir() + "/" + record + "/" + kPMSUpgradedFromMember, &text,
                    256)) {
    return "";
  }
  if (!text.empty() && text.back() == '\n') text.pop_back();
  return PackageRegistry::IsRecordNameOf(id, ".records/" + text) ? text : "";
}

bool PMSRenameCopy(const std::string& from, const std::string& to, PMSRenameSync sync) {
  if (sync == PMSRenameSync::kNow) return PMSRenameDurably(from, to);
  return rename(from.c_str(), to.c_str()) == 0;
}

bool PMSRenameDurably(const std::string& from, const std::string& to) {
  if (rename(from.c_str(), to.c_str()) != 0) return false;
  SyncDir(Parent(to));
  if (Parent(from) != Parent(to)) SyncDir(Parent(from));
  return true;
}

DataSnapshot::DataSnapshot(std::string appdata, std::string id, std::string record)
    : appdata_(std::move(appdata)), id_(std::move(id)), record_(std::move(record)) {}

bool DataSnapshot::IsValid() const {
  return PackageRegistry::IsRecordNameOf(id_, ".records/" + record_) &&
         PMSIsStrictlyInside(copy(), PMSSnapshotsDir(appdata_)) &&
         PMSIsStrictlyInside(data_dir(), appdata_);
}

std::string DataSnapshot::folder() const { return PMSSnapshotsDir(appdata_) + "/" + id_; }

std::string PMSSnapshotsDir(const std::string& appdata) { return appdata + "/.snapshots"; }

bool PMSSnapshotsShareBlocks(const std::string& appdata) {
  const std::string dir = PMSSnapshotsDir(appdata);
  if (KIVOFSMkdirP(dir.c_str(), 0700) != 0) return false;
  const bool shared = PMSCanReflink(dir);
  rmdir(dir.c_str());  // only when no copy is in it
  return shared;
}

bool PMSDataCopyRoom(const std::string& appdata, const std::string& data_dir, uint64_t* bytes,
                     std::string* problem) {
  *bytes = 0;
  if (!KLIBCFileExist(data_dir.c_str())) return true;  // no data to copy
  // A snapshot holds whatever the subvolume holds, takes no room and reads
  // nothing: walking the tree would cost what the snapshot saves.
  if (PMSCopiesBySnapshot(data_dir)) return true;
  TreeSurvey survey;
  if (!PMSSurveyTree(data_dir, &survey)) {
    *problem = survey.problem;
    return false;
  }
  if (!PMSSnapshotsShareBlocks(appdata)) *bytes = survey.bytes;
  return true;
}

TreeCopyResult PMSTakeSnapshot(const DataSnapshot& s, std::string* error) {
  if (!s.IsValid()) {
    *error = "the copy's name is not valid";
    return TreeCopyResult::kFailed;
  }
  // The copies may hold whatever the packages keep: only root reads them.
  const std::string partial = s.Named(".copying");
  if (KIVOFSMkdirP(s.folder().c_str(), 0700) != 0 || !PMSRemoveTree(s.folder(), partial)) {
    *error = Because("cannot prepare the folder of the copy");
    return TreeCopyResult::kFailed;
  }
  // A snapshot is made whole in the transaction that creates it, and the
  // call returns once that transaction is on disk: it takes its final name
  // at once, with nothing partial to hide and nothing left to sync (a
  // rename and a sync of the folder would cost as much again).
  const bool by_snapshot = PMSCopiesBySnapshot(s.data_dir());
  TreeCopyResult result = by_snapshot ? Snapshot(s.data_dir(), s.copy(), error)
                                      : PMSCopyTree(s.data_dir(), partial, error);
  if (result == TreeCopyResult::kCopied && !by_snapshot && !PMSRenameDurably(partial, s.copy())) {
    *error = Because("cannot complete the copy");
    result = TreeCopyResult::kFailed;
  }
  if (result != TreeCopyResult::kCopied) {
    // What stays is an incomplete copy, which the next clean-up removes.
    static_cast<void>(PMSRemoveTree(s.folder(), partial));
    RemoveEmptyFolders(s);
  }
  return result;
}

bool PMSDiscardSnapshot(const DataSnapshot& s, PMSRenameSync sync) {
  const std::string gone = s.Named(".discard");
  if (!s.IsValid()) {
    errno = EINVAL;
    return false;
  }
  if (!PMSRenameCopy(s.copy(), gone, sync)) return false;
  static_cast<void>(PMSRemoveTree(s.folder(), gone));
  RemoveEmptyFolders(s);
  return true;
}

RestoreState PMSRestoreSnapshot(const DataSnapshot& s, std::string* error) {
  PMSFaultPoint("restore_begun");
  if (!s.IsValid() || (!Exists(s.copy()) && !Exists(s.Named(".replaced")))) {
    *error = "there is no copy of the data to put back";
    return RestoreState::kNoCopy;
  }
  if (!Exists(PackageRegistry::RecordsDir() + "/" + s.record() + "/INFO")) {
    *error = "the previous version's record is gone";
    return RestoreState::kNoCopy;
  }
  if (Exists(s.copy())) {
    RestoreState state = PutCopyBack(s, error);
    if (state != RestoreState::kRestored) return state;
  }
  if (!PublishAgain(s, error)) return RestoreState::kNotPublished;
  PMSFaultPoint("old_published");
  // What the failed version left is no one's now; a removal that fails is
  // finished by the next operation's clean-up.
  static_cast<void>(PMSRemoveTree(s.folder(), s.Named(".replaced")));
  RemoveEmptyFolders(s);
  return RestoreState::kRestored;
}
