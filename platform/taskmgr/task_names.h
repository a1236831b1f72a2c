// The names of the package center's tasks. The module, the package tool,
// the feasibility check, the package server library and kivoctl each find
// the others' tasks by these names (kivoctl's download, for one, runs in the
// task the desktop's downloads use, so neither starts a second download of
// the same package), so they are spelled here and nowhere else. A task's
// id is its kind's prefix and the package id, except an upload's, which is
// the prefix and a unique id (TaskUtil::getUniqueID).
#pragma once

namespace KIVOPackageTasks {

// The owner of every package task.
inline constexpr char kTaskOwner[] = "@administrators";

// The prefix every package task's id starts with (a listing of them all).
inline constexpr char kPackageTaskPrefix[] = "@KIVOPKG_";
// A package file uploaded and waiting for its install.
inline constexpr char kUploadPrefix[] = "@KIVOPKG_UPLOAD_";
// A download or an install, queued or under way.
inline constexpr char kDownloadPrefix[] = "@KIVOPKG_DOWNLOAD_";
// A start or a stop under way.
inline constexpr char kStartStopPrefix[] = "@KIVOPKG_STARTSTOP_";
// An uninstall under way.
inline constexpr char kUninstallPrefix[] = "@KIVOPKG_UNINSTALL_";
// A rollback to a kept earlier version, under way or with its outcome.
inline constexpr char kRollbackPrefix[] = "@KIVOPKG_ROLLBACK_";

}  // namespace KIVOPackageTasks
