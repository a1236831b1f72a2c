// The package task record that long operations share: ids (named by the task
// manager, taskmgr/task_names.h), and the liveness rule readers apply.
#pragma once

#include <string>

#include <json/value.h>

#include "taskmgr/task.h"
#include "taskmgr/task_names.h"

namespace KIVO_PACKAGE {

using KIVOPackageTasks::kDownloadPrefix;
using KIVOPackageTasks::kPackageTaskPrefix;
using KIVOPackageTasks::kStartStopPrefix;
using KIVOPackageTasks::kTaskOwner;
using KIVOPackageTasks::kUninstallPrefix;
using KIVOPackageTasks::kUploadPrefix;

// True when `data` names an integer "pid" of a living process.
bool TaskProcessAlive(const Json::Value& data);

// True for a job that is not finished (and not yet recorded as failed) but
// whose worker process ("pid") has ended: it will never finish by itself.
bool WorkerGone(NVX::Task& task, const Json::Value& data);

// The job of such a task reads as failed from then on: `data` gets
// "installing" false, "error" (4501) and "message", and the task is written
// back and finished with false. False when the task could not be written.
[[nodiscard]] bool RecordWorkerGone(NVX::Task& task, Json::Value& data);

// Removes a task whose job is over. One that cannot be removed now is left
// (with a log line) for the first reader that finds its worker gone.
void DropTask(NVX::Task& task);

// What a reader does with a stale task (`data` is its "data"): an install
// or download job ("@KIVOPKG_DOWNLOAD_", with a "pid", not a queued install)
// that never finished is recorded as failed, since its starter polls
// "status" for the outcome; any other stale task is removed. A failed
// clean-up is logged; the next reader tries again.
void EndStaleTask(NVX::Task& task, Json::Value& data);

}  // namespace KIVO_PACKAGE
