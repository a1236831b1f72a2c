// The activity log's entry of a server install through the web API
// ("Installation.install" with "name"): the request begins it, and the
// download's worker, which outlives the request, ends it with how the
// download (and, for a quick install, the install) went. A worker killed half
// way leaves it unfinished.
#pragma once

#include <sys/types.h>

#include "taskmgr/task.h"

namespace KIVO_PACKAGE {

// In the request, once the worker is forked and before it is released:
// hands the request's entry to `worker`. A failure is in syslog; the
// request then ends the entry with its own answer.
void HandDownloadEntryTo(pid_t worker);

// In the worker, when its work is over (before it lets go of `task`): ends
// the entry with the outcome the task reports, or with the cancel. A reader
// of the task's progress leaves a finished task alone while its worker
// lives, so the task is still there to read.
void EndDownloadEntry(NVX::Task* task, bool canceled);

}  // namespace KIVO_PACKAGE
