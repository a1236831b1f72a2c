// What the package tool knows of an installed package: its record as a
// PackageInfo, and whether it runs.
//
// Running is decided without starting a process when the package declares a
// pid file (INFO "pidfile", relative to its data folder): the package runs
// when that file names a living process. Only packages without one are asked
// through their start-stop-status script ("status", exit 0 = running), so
// listing many packages costs no process per package.
#pragma once

#include <string>
#include <vector>

#include "pkgtool/package_info.h"

// Fills `info` from the published record of `id`: INFO, install target,
// which wizards it has, licence text. False when `id` is not installed.
bool PMSLoadInstalled(const std::string& id, PackageInfo* info);

// True when the installed package `id` runs (see above).
bool PMSIsRunning(const std::string& id, const PackageInfo& info);

// Installed packages whose dependencies name `id`.
std::vector<std::string> PMSInstalledDependents(const std::string& id);
