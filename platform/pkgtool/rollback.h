// Rolling a package back to its kept revision (revisions.h), and the
// journal that makes a rollback survive a crash at any step.
//
// With P the published version, D = <volume>/@appdata/<id> its data folder
// and R the most recently replaced kept version, a rollback
//   1. stops P when it runs;
//   2. renames <R>.kept to <R>.back: the rollback is decided;
//                                                      [fault rollback_begun]
//   3. writes REPLACED into P's record and renames D to <P>.kept: the data P
//      wrote becomes P's kept revision, so a second rollback undoes the
//      first;                                          [rollback_data_kept]
//   4. publishes R;                                    [rollback_published]
//   5. renames <R>.back to D;
//   6. starts R when P ran (R's record then says it is meant to run), and
//      drops kept versions beyond keep_revisions (at least P's stays).
//                                                      [rollback_done]
// While <R>.back exists the rollback is under way. The next operation
// (upgrade_recovery.h) stops the published version and finishes steps 3 to
// 5, as far as they were not done; R is then left stopped. So after a
// crash the package is P with P's data or, once finished, R with R's data.
#pragma once

#include <string>

#include "pkgtool/data_snapshot.h"

// The suffix of a kept copy while a rollback to its version is under way.
inline constexpr char kPMSRollbackSuffix[] = ".back";

enum class RollbackState {
  kDone,        // R is published over its own data; P's data is kept as <P>.kept
  kUntouched,   // nothing changed since <R>.back: P is published over D
  kDataKept,    // D was kept as <P>.kept, P is still published, D is missing
  kNoDataBack,  // R is published, D is missing, its data is still <R>.back
};

// Steps 3 to 5 above for the rollback to the version of `s` (its record
// R), from wherever an earlier try stopped. Every process of the published
// version must have stopped. Must run under the tool's lock. *error says
// what failed.
[[nodiscard]] RollbackState PMSFinishRollback(const DataSnapshot& s, std::string* error);
