// The package task record that long operations share: ids, and the liveness
// rule readers apply.
#pragma once

#include <string>

#include <json/value.h>

#include "taskmgr/task.h"

namespace KIVO_PACKAGE {

constexpr char kTaskOwner[] = "@administrators";
constexpr char kUploadPrefix[] = "@KIVOPKG_UPLOAD_";
constexpr char kDownloadPrefix[] = "@KIVOPKG_DOWNLOAD_";
constexpr char kStartStopPrefix[] = "@KIVOPKG_STARTSTOP_";
constexpr char kUninstallPrefix[] = "@KIVOPKG_UNINSTALL_";

// True when `data` names an integer "pid" of a living process.
bool TaskProcessAlive(const Json::Value& data);

}  // namespace KIVO_PACKAGE
