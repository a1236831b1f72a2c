// Finishing what an interrupted upgrade left (data_snapshot.h says how an
// upgrade journals itself in the names of its data copy).
//
// An upgrade that was killed before it was confirmed is undone: the version
// it replaced comes back with the data it had. An upgrade killed in the
// middle of a restore has that restore finished. Either way the package is
// whole again, in its old state, before any other operation reads it. A
// rollback that was killed (rollback.h) is finished likewise.
#pragma once

#include <set>
#include <string>

// For every package with a data copy on any volume: finishes a rollback
// under way; stops the published version when it is not the copy's and
// runs, puts the copy back in place of the data folder and publishes the
// copy's version again. Removes incomplete copies, discarded ones, kept
// revisions that are not whole or whose package is not installed
// (revisions.h), and entries of the copies' folders that are no copy's. A
// restored version is left stopped; its record keeps whether it is meant to
// run. Each restore is written to the system log.
//
// Must run under the tool's exclusive lock, before anything reads the
// registry to change it. `kept` (may be null) gets the record names of
// kept revisions and of versions whose copy could not be put back yet:
// their records and payloads must stay. False when something stays to be
// done.
[[nodiscard]] bool PMSRecoverUpgrades(std::set<std::string>* kept);
