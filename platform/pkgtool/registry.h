// The installed-package registry under "/var/packages" of the system root.
//
//   var/packages/<id>              symlink to .records/<id>.<nonce>
//   var/packages/.records/<id>.<n> one version's record:
//       INFO        the package's INFO as installed
//       scripts/, WIZARD_UIFILES/, LICENSE, PACKAGE_ICON*.PNG
//       target ->   <volume>/@appstore/<id>.<n>  (the payload)
//       var    ->   <volume>/@appdata/<id>       (data, kept across upgrades)
//       enabled     present while the package is meant to run
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
bool IsInstalled(const std::string& id);
// Reads the published record's INFO.
bool ReadInfo(const std::string& id, KeyValueMap* info);
// Installed package ids, sorted.
std::vector<std::string> List();
// The record folder name `id` is published as (".records/<id>.<n>"), "" if none.
std::string PublishedRecord(const std::string& id);
// Publishes `record` (a name under .records) as `id`, replacing any earlier
// record in one rename. False with errno on failure.
bool Publish(const std::string& id, const std::string& record);
// Removes the published name of `id` (the record folder stays for clean-up).
bool Unpublish(const std::string& id);
// A fresh record name for `id`: "<id>.<random>".
std::string NewRecordName(const std::string& id);

}  // namespace PackageRegistry

// Package ids are 1 to 64 characters of [A-Za-z0-9._+-], starting with a
// letter or digit. Everything that turns an id into a path checks this first.
bool PMSIsValidPackageId(const std::string& id);

// True when `rel` is a relative path that stays inside its base folder
// lexically: not empty, not absolute, no "." or ".." component.
bool PMSIsContainedRelativePath(const std::string& rel);
