// Kept revisions: the version an upgrade replaced, kept whole (its record,
// its payload and the copy of its data taken before the upgrade) so that
// the administrator can go back to it (rollback.h).
//
//   <volume>/@appdata/.snapshots/<id>/<R>.kept   the data of version R as R
//                                                left it when it was replaced
//   var/packages/.records/<R>                    R's record, as it was
//   var/packages/.records/<R>/REPLACED           when R was replaced (seconds
//                                                since 1970 and nanoseconds,
//                                                "<s>.<ns>", one line)
//   <volume>/@appstore/<R>                       R's payload (R/target)
//
// The name <R>.kept is what makes R a revision: the upgrade's copy <R>
// (data_snapshot.h) is renamed to it in one step after REPLACED was written
// and the upgrade confirmed (a crash before the rename is on disk leaves it
// to the clean-up, which UPGRADED_FROM tells what to finish). A package file cannot hold a member
// named REPLACED, so no package can claim a replacement time. Up to `keep_revisions`
// (etc/kivo/pkgtool.conf, 1 by default, 0 for none) are kept per package, the newest; an upgrade or
// a rollback drops the older.
//
// Everything read here is checked whole before it is trusted: a name that
// is not "<record of the id>.kept", a record without INFO or REPLACED, a
// record that is the published one, a payload outside the volume's
// @appstore or a data link to another folder makes the entry no revision;
// the next operation's clean-up (upgrade_recovery.h) removes it.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>
#include <vector>

#include "pkgtool/data_snapshot.h"

// The suffix of a kept revision's data copy.
inline constexpr char kPMSKeptSuffix[] = ".kept";
// The record member that says when a kept version was replaced.
inline constexpr char kPMSReplacedMember[] = "REPLACED";

// "keep_revisions" of etc/kivo/pkgtool.conf: how many replaced versions a
// package keeps (1 by default; 0 keeps none).
int PMSKeepRevisionsSetting();

struct PMSRevision {
  std::string appdata;  // "<root>/<volume>/@appdata", where its copy lies
  std::string id;
  std::string record;  // "<id>.<nonce>", the record name R
  std::string version;
  std::string payload;  // "<root>/<volume>/@appstore/<R>"
  // When it was replaced, to the nanosecond: the newest is rolled back to.
  time_t replaced = 0;
  long replaced_ns = 0;

  DataSnapshot snapshot() const { return DataSnapshot(appdata, id, record); }
  // "<appdata>/.snapshots/<id>/<R>.kept".
  std::string copy() const { return snapshot().Named(kPMSKeptSuffix); }
};

// True, with *out filled, when "<appdata>/.snapshots/<id>/<record>.kept" is
// a whole kept revision of `id` (see above).
[[nodiscard]] bool PMSReadRevision(const std::string& appdata, const std::string& id,
                                   const std::string& record, PMSRevision* out);

// The whole kept revisions of `id` on every volume, the most recently
// replaced first. Takes no lock: a reader may miss one that changes as it
// reads.
std::vector<PMSRevision> PMSListRevisions(const std::string& id);

// Makes the folder `from` the kept copy of version R (the record of `s`):
// writes REPLACED (now) into R's record, then renames `from` to <R>.kept
// durably. A rollback passes the data folder of the version it leaves.
// False (errno set) when either step failed: `from` is then where it was.
[[nodiscard]] bool PMSKeepAsRevision(const DataSnapshot& s, const std::string& from);

// The first step of PMSKeepAsRevision: REPLACED (now) into the record of
// `s`, on disk. An upgrade's commit takes it before it confirms the upgrade
// and renames its copy <R> to <R>.kept. False (errno set) when it failed.
[[nodiscard]] bool PMSMarkReplaced(const DataSnapshot& s);

// Removes a kept revision: its copy is renamed to <R>.discard (from then on
// it is no revision) and removed, then its record and payload. False when
// something stays; the next operation's clean-up removes it.
[[nodiscard]] bool PMSDropRevision(const PMSRevision& r);

// Drops the kept revisions of `id` beyond the `keep` most recent. False when
// something stays to be removed.
[[nodiscard]] bool PMSTrimRevisions(const std::string& id, int keep);

// When a revision was replaced, for people: "2025-03-01 12:00:00 UTC".
std::string PMSReplacedText(time_t when);

// The room a kept revision takes on disk: the blocks of its data copy and
// of its payload (a file with several links counted once).
uint64_t PMSRevisionBytes(const PMSRevision& r);
