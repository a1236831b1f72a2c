// The package server library's automatic-update settings: whether packages
// update themselves, for all packages or a chosen list. The switches are the
// keys "enable_pkg_autoupdate_all" and "pkg_autoupdate_all" of
// /etc/kivoinfo.conf; the chosen list is the JSON array of package ids in
// "/usr/kivo/etc/packages/autoupdate.json" under the system root. Beside it,
// "autoupdate-failures.json" remembers the versions an automatic update
// failed to install, so that a run does not try them again.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include <json/value.h>

namespace KIVOPackageServer {

// What the switches say. Every reader of them (the web API's settings, its
// list and get, kivoctl auto-update) asks ReadMode, so that they agree.
enum class AutoUpdateMode {
  kOff,     // packages are not updated automatically
  kAll,     // every installed package is
  kChosen,  // the packages of the chosen list are
};

// Off unless "enable_pkg_autoupdate_all" is "yes"; when on, the chosen list
// only when "pkg_autoupdate_all" is "no", every package otherwise (also when
// the key is absent: Save writes both keys, and the first one alone says
// automatic update of all packages). Both compare ignoring case; a settings
// file that cannot be read reads as off.
AutoUpdateMode ReadMode();

// The chosen list (an empty array when none is stored). False when the
// stored list cannot be read or is not an array of strings.
bool List(Json::Value& ids);

// Stores the switches and the chosen list (null or an array of ids; other
// values are refused). Each part is written atomically. False on failure.
bool Save(bool enable, bool all, const Json::Value& ids);

// A version of a package that an automatic update failed to install.
struct AutoUpdateFailure {
  std::string version;  // the version that failed
  int64_t time = 0;     // when, in seconds since the epoch
  int code = 0;         // the package tool's result (PKG_ERRCODE)
  std::string reason;   // one line saying what failed
  // The record the package was published as after the failure
  // (".records/<id>.<n>", PackageRegistry::PublishedRecord). The entry holds
  // only while that record stays published: an uninstall, a new install or
  // any upgrade publishes another one and so forgets the failure.
  std::string record;
};
// Package id -> its failure.
using AutoUpdateFailures = std::map<std::string, AutoUpdateFailure>;

// The stored failures that still hold (see `record`). The file is checked
// whole: ids by PMSIsValidPackageId, versions by PMSIsValidVersion, a code
// of the tool, a time, a reason of one line, a record name of the id, and
// nothing else. A file that fails any check is read as empty (and logged);
// a missing file is empty. Nothing is written.
AutoUpdateFailures ReadFailures();

// Stores `failure` as the failure of package `id`, replacing any earlier
// one, and drops the entries that no longer hold; a damaged file is
// replaced. False (the last error set) when it cannot be written or the
// entry would not pass the checks above.
[[nodiscard]] bool RecordFailure(const std::string& id, const AutoUpdateFailure& failure);

// Forgets the failure of `id`, drops the entries that no longer hold and
// replaces a damaged file. False when it cannot be written.
[[nodiscard]] bool ForgetFailure(const std::string& id);

// Drops the entries that no longer hold (an uninstalled package's, too) and
// replaces a damaged file. False when it cannot be written.
[[nodiscard]] bool DropFailuresThatNoLongerHold();

// One line for `reason` as a failure keeps it: the first line of a
// message, control characters as spaces, at most 300 bytes, without a
// final full stop.
std::string FailureReasonLine(const std::string& message);

}  // namespace KIVOPackageServer
