// The package server library's automatic-update settings: whether packages
// update themselves, for all packages or a chosen list. The switches are the
// keys "enable_pkg_autoupdate_all" and "pkg_autoupdate_all" of
// /etc/kivoinfo.conf; the chosen list is the JSON array of package ids in
// "/usr/kivo/etc/packages/autoupdate.json" under the system root.
#pragma once

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

}  // namespace KIVOPackageServer
