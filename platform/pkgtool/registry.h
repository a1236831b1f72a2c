// The installed-package registry under "/var/packages" of the system root.
//
//   var/packages/<id>              symlink to .records/<id>.<nonce>
//   var/packages/.records/<id>.<n> one version's record:
//       INFO        the package's INFO as installed
//       ORIGIN      where it came from and who signed it (package_origin.h)
//       scripts/, WIZARD_UIFILES/, LICENSE, PACKAGE_ICON*.PNG
//       target ->   <volume>/@appstore/<id>.<n>  (the payload)
//       var    ->   <volume>/@appdata/<id>       (data, kept across upgrades)
//       enabled     present while the package is meant to run
//       UPGRADED_FROM   the record this version replaced, once the upgrade
//                   to it is confirmed (data_snapshot.h)
//       restarts, crashed   the watchdog's restarts and its giving up
//                   (watchdog_record.h)
//
// A package is installed exactly when var/packages/<id> resolves to a record
// with an INFO file. A record is built completely under a fresh name and
// published by renaming a new symlink over var/packages/<id>: one atomic
// step, so a crash leaves the old state or the new one, never half. Records
// and payload folders that no symlink reaches are leftovers of an
// interrupted operation; PMSRecoverLeftovers removes them.
#pragma once

#include <string>
#include <vector>

#include "klibc/key_value_file.h"

namespace PackageRegistry {

// "<root>/var/packages".
std::string Dir();
// "<root>/var/packages/<id>" (the published name); `id` must be valid.
std::string RecordDir(const std::string& id);
// "<root>/var/packages/.records".
std::string RecordsDir();
// True when a record with an INFO file is published for `id`.
[[nodiscard]] bool IsInstalled(const std::string& id);
// Reads the published record's INFO.
[[nodiscard]] bool ReadInfo(const std::string& id, KeyValueMap* info);
// Installed package ids, sorted.
std::vector<std::string> List();
// The record folder name `id` is published as (".records/<id>.<n>"), "" if
// none. Only the link is read: the record may be gone or incomplete.
std::string PublishedRecord(const std::string& id);
// The record folder `id` is published as ("<root>/var/packages/.records/
// <id>.<n>"), or "" when `id` is not published as a record of its own: an
// invalid id, no link, or a link that leads anywhere else. A caller that is
// about to remove the record must hold the tool's lock while it reads this.
std::string PublishedRecordPath(const std::string& id);
// True when `record` is a name that may be published for `id`:
// ".records/<id>.<something>", one folder strictly inside the records folder.
bool IsRecordNameOf(const std::string& id, const std::string& record);
// Publishes `record` (a name under .records, see IsRecordNameOf) as `id`,
// replacing any earlier record in one rename. False with errno on failure,
// or when the id or the record name is not valid (nothing is changed then).
[[nodiscard]] bool Publish(const std::string& id, const std::string& record);
// Removes the published name of `id` (the record folder stays for clean-up).
// False when `id` is invalid or there was no published name to remove.
[[nodiscard]] bool Unpublish(const std::string& id);
// A fresh record name for `id`: "<id>.<random>". "" when no random bytes
// could be had; a caller must not build a path from an empty name.
[[nodiscard]] std::string NewRecordName(const std::string& id);

}  // namespace PackageRegistry

// Package ids are 1 to 64 characters of [A-Za-z0-9._+-], starting with a
// letter or digit. Everything that turns an id into a path checks this first.
bool PMSIsValidPackageId(const std::string& id);

// True when `rel` is a relative path that stays inside its base folder
// lexically: not empty, not absolute, no "." or ".." component.
bool PMSIsContainedRelativePath(const std::string& rel);

// True when `path` lies strictly inside the folder `owner`, judged on the
// text alone: `owner` is a non-empty absolute path and `path` is `owner`, a
// slash and a contained relative path (see above). Every destructive step of
// the package tool (rm -rf, a rename over a name) checks its path with this
// against the folder it owns, so an empty or damaged name can never widen
// the step to the owner itself or to anything beside it.
bool PMSIsStrictlyInside(const std::string& path, const std::string& owner);

// True when a symlink at `path` (relative to the top of a tree) pointing at
// `target` stays inside that tree: the target is relative and never climbs
// above the top on its way. Payload entries and the data folder's copy are
// judged by this one rule.
bool PMSSymlinkStaysInside(const std::string& path, const std::string& target);
