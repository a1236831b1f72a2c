// The installed-package registry: one folder per installed package under
// "/var/packages" of the system root, named after the package id.
//
//   var/packages/<id>/INFO    the package's INFO as installed (key/value)
//   var/packages/<id>/target  the folder the payload is installed in
//   var/packages/<id>/var     the package's own data folder (kept on upgrade)
//
// A package is installed exactly when its folder exists with an INFO file:
// the package tool builds a record elsewhere and renames it into place last,
// so a reader never sees half a record.
#pragma once

#include <string>

#include "klibc/key_value_file.h"

namespace PackageRegistry {

// "<root>/var/packages".
std::string Dir();
// "<root>/var/packages/<id>"; `id` must be valid (PMSIsValidPackageId).
std::string RecordDir(const std::string& id);
// True when a record with an INFO file exists for `id`.
bool IsInstalled(const std::string& id);
// Reads the record's INFO. False when the package is not installed or the
// file cannot be read.
bool ReadInfo(const std::string& id, KeyValueMap* info);

}  // namespace PackageRegistry

// Package ids are 1 to 64 characters of [A-Za-z0-9._+-], starting with a
// letter or digit. Everything that turns an id into a path checks this first.
bool PMSIsValidPackageId(const std::string& id);

// True when `rel` is a relative path that stays inside its base folder
// lexically: not empty, not absolute, no "." or ".." component.
bool PMSIsContainedRelativePath(const std::string& rel);
