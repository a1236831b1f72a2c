// Pieces shared by the package tool's changing operations: the scripts'
// environment, running one script into the operation log, progress, fault
// injection for crash tests, and clean-up of interrupted operations.
#pragma once

#include <map>
#include <set>
#include <string>

#include <json/value.h>

#include "pkgtool/operation.h"
#include "pkgtool/package_info.h"

// The environment a package script runs with:
//   KIVO_PKG_NAME, KIVO_PKG_VERSION, KIVO_PKG_OPERATION (install, upgrade,
//   uninstall, start, stop), KIVO_PKG_DEST (the installed files),
//   KIVO_PKG_VAR (the data folder), KIVO_PKG_OLD_VERSION (upgrades),
//   KIVO_WORKER_MSG (a file: each line is a message for the user),
//   KIVO_WIZARD_VALUES (a file with the wizard's answers as JSON) and
//   KIVO_WIZARD_<key> for each top-level answer that is a string, number or
//   bool, KIVO_ROOT, PATH, LANG, HOME.
std::map<std::string, std::string> PMSScriptEnv(const PackageInfo& info, const std::string& record,
                                                const std::string& operation, const Operation& op,
                                                const Json::Value& wizard_values,
                                                const std::string& old_version = "");

// Runs `record`/scripts/`name` (missing scripts succeed) and logs how it
// ended. True when it succeeded.
[[nodiscard]] bool PMSRunPackageScript(const std::string& record, const std::string& name,
                                       const std::string& arg,
                                       const std::map<std::string, std::string>& env,
                                       const Operation& op);

// Publishes install progress of `id` (0.0 to 1.0) for PMSGetProgress. The
// figure is a hint for readers: a write that fails leaves the last one.
void PMSSetProgress(const std::string& id, double progress);
void PMSClearProgress(const std::string& id);

// Crash tests: when $KIVO_PKGTOOL_FAULT names `step`, the process kills
// itself with SIGKILL right there, as a power cut or `kill -9` would.
void PMSFaultPoint(const char* step);

// Finishes or undoes interrupted upgrades (upgrade_recovery.h), then
// removes records and payload folders that no published record reaches,
// and half-made temporary names: what an interrupted operation leaves.
// Must run under the tool's exclusive lock. False when something could not
// be removed (it is tried again by the next operation).
[[nodiscard]] bool PMSRecoverLeftovers();

// The names in folder `dir`, without "." and ".."; none when it cannot be
// read.
std::set<std::string> PMSListDir(const std::string& dir);

// rm -rf `path`, the one way the package tool removes a folder: only when
// `path` lies strictly inside `owner` (PMSIsStrictlyInside); anything else is
// refused without touching the disk. A Btrfs subvolume (a data folder or its
// snapshot, btrfs_subvolume.h) is destroyed whole instead, as are the emptied
// subvolumes inside a folder removed. True when `path` is gone afterwards.
[[nodiscard]] bool PMSRemoveTree(const std::string& owner, const std::string& path);

// The `kind` folder ("@appstore" or "@appdata") of the configured volume
// that holds `path` strictly inside it, "<root>/<volume>/<kind>"; "" when no
// volume's folder of that kind holds it. The owner to check a payload or
// data folder against before it is removed.
std::string PMSVolumeFolderHolding(const std::string& path, const char* kind);
