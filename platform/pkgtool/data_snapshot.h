// The safety copy of a package's data folder during an upgrade: taking it,
// putting it back, and dropping it once the upgrade is confirmed.
//
// The copy lies beside the data folder D = <volume>/@appdata/<id>, on the
// same file system so that it moves back by rename, and never inside it:
//
//   <volume>/@appdata/.snapshots/<id>/<R>.copying   a copy being made file by file
//                                                   (a Btrfs snapshot appears
//                                                   whole as <R>)
//   <volume>/@appdata/.snapshots/<id>/<R>           D as version R left it
//   <volume>/@appdata/.snapshots/<id>/<R>.replaced  D as the failed version
//                                                   left it, moved aside by
//                                                   a restore under way
//   <volume>/@appdata/.snapshots/<id>/<R>.discard   a copy being removed
//   <volume>/@appdata/.snapshots/<id>/<R>.kept      D as version R left it, kept
//                                                   after a confirmed upgrade
//                                                   (revisions.h)
//   <volume>/@appdata/.snapshots/<id>/<R>.back      the same, while a rollback
//                                                   to R is under way (rollback.h)
//
// <R> is the record name ("<id>.<nonce>", registry.h) of the version being
// replaced. ".snapshots" is never a package's data folder: ids start with a
// letter or a digit.
//
// The names are the upgrade's journal, each changed by one rename. While
// <R> exists and the published version's record does not name R in its
// UPGRADED_FROM member, the upgrade away from R is not confirmed, and a
// crash leaves the next operation to put R back with its data
// (upgrade_recovery.h). The upgrade's commit writes UPGRADED_FROM into the
// new version's record, on disk before it goes on: from then on the new
// version stays. Only then is <R> renamed to <R>.kept (revisions.h) or
// <R>.discard, without waiting for the volume to write the rename: a rename
// of a Btrfs subvolume reaches the disk only with a commit of the whole
// file system (about 2 ms), and after a crash the clean-up finishes what
// UPGRADED_FROM says. A restore renames D to <R>.replaced, then <R> to D,
// then publishes R again; while <R>.replaced exists, those steps are under
// way for R.
#pragma once

#include <string>

#include "pkgtool/tree_copy.h"

// The INFO key by which a package says that its data needs no copy before
// an upgrade ("no"): it is too large to copy, or nothing an upgrade does to
// it needs undoing. Yes by default.
inline constexpr char kPMSDataCopyKey[] = "upgrade_data_copy";

class DataSnapshot {
 public:
  // `appdata` is "<root>/<volume>/@appdata", `record` the record name R of
  // the version whose data is copied. Both must be valid (IsValid).
  DataSnapshot(std::string appdata, std::string id, std::string record);

  // True when the id and the record name are valid and the record name is
  // one of the id's, so that every path below stays inside `appdata`.
  bool IsValid() const;
  const std::string& id() const { return id_; }
  const std::string& record() const { return record_; }
  const std::string& appdata() const { return appdata_; }
  std::string data_dir() const { return appdata_ + "/" + id_; }
  // ".snapshots/<id>", the folder of the id's copies.
  std::string folder() const;
  // ".snapshots/<id>/<R>", the copy itself.
  std::string copy() const { return Named(""); }
  // ".snapshots/<id>/<R><suffix>".
  std::string Named(const char* suffix) const { return folder() + "/" + record_ + suffix; }

 private:
  std::string appdata_, id_, record_;
};

// Renames `from` to `to` and makes the change durable in both folders: the
// names of the copies are journals. False (errno set) when it failed.
[[nodiscard]] bool PMSRenameDurably(const std::string& from, const std::string& to);

// When a rename that ends a step must be on disk: before the call returns,
// or with the volume's next write-back, when a record already on disk says
// what the rename finishes (UPGRADED_FROM), so that the clean-up after a
// crash can finish it.
enum class PMSRenameSync { kNow, kWithTheVolume };

// Renames `from` to `to`, durably (PMSRenameDurably) with kNow. False
// (errno set) when it failed.
[[nodiscard]] bool PMSRenameCopy(const std::string& from, const std::string& to,
                                 PMSRenameSync sync);

// The member of a version's record that confirms the upgrade to it: the
// record name R of the version it replaced, one line.
inline constexpr char kPMSUpgradedFromMember[] = "UPGRADED_FROM";

// The upgrade's commit: writes kPMSUpgradedFromMember, naming the record of
// `s`, into the record folder `new_record` of the version that replaces it,
// and waits until it is on disk. False (errno set) when it could not.
[[nodiscard]] bool PMSConfirmUpgrade(const DataSnapshot& s, const std::string& new_record);

// The record name R that the upgrade to record folder `record` of `id`
// confirmed, checked whole (a record name of `id`); "" for none.
std::string PMSUpgradedFrom(const std::string& id, const std::string& record);

// "<appdata>/.snapshots", the folder of every package's copies on a volume.
// It exists only while a copy is in it.
std::string PMSSnapshotsDir(const std::string& appdata);

// True when copies in `appdata`'s copies folder share blocks with the data
// (reflinks), so that a copy takes no room: probed with files made there and
// removed again (as is the folder, when it was made for the probe).
[[nodiscard]] bool PMSSnapshotsShareBlocks(const std::string& appdata);

// The room a safety copy of the data folder `data_dir` would take in
// `appdata`'s copies folder now: 0 when there is no data folder, when it
// is copied by a Btrfs snapshot (PMSCopiesBySnapshot; the tree is then not
// walked) or when the copies share blocks with the data, else the tree's
// size (TreeSurvey).
// False, with *problem in words, when the data cannot be copied safely.
// The upgrade itself and the feasibility check's advice both judge by it.
[[nodiscard]] bool PMSDataCopyRoom(const std::string& appdata, const std::string& data_dir,
                                   uint64_t* bytes, std::string* problem);

// Copies D to <R> (made as <R>.copying and renamed when whole): a snapshot
// when PMSCopiesBySnapshot(D) (btrfs_subvolume.h), else a copy of the tree
// (PMSCopyTree). The package must be stopped. On failure nothing of the
// copy stays (unless it cannot be removed: the next operation's clean-up
// removes a .copying) and *error says why; D is never changed.
[[nodiscard]] TreeCopyResult PMSTakeSnapshot(const DataSnapshot& s, std::string* error);

// Drops the copy: it is renamed to <R>.discard, then removed. False (errno
// set) when it could not be renamed. A .discard that could not be removed
// now is removed by the next operation's clean-up. `sync` kWithTheVolume
// only once the upgrade is confirmed (PMSConfirmUpgrade).
[[nodiscard]] bool PMSDiscardSnapshot(const DataSnapshot& s,
                                      PMSRenameSync sync = PMSRenameSync::kNow);

enum class RestoreState {
  kRestored,      // D holds the copy again and R is published
  kUntouched,     // nothing changed: D holds what the failed version left; the copy stays
  kDataAside,     // D is missing: the failed version's data is at <R>.replaced, the copy at <R>
  kNotPublished,  // D holds the copy again but R could not be published again
  kNoCopy,        // there is no copy of R to put back
};

// Puts the copy back in place of D and publishes R as the package when it
// is not published already, then removes what the failed version left.
// Resumes a restore that was interrupted. Every process of the version
// that used D must have stopped. Must run under the tool's lock. *error
// says what failed.
[[nodiscard]] RestoreState PMSRestoreSnapshot(const DataSnapshot& s, std::string* error);
