// "KIVO.Core.Package.Usage": what each installed package uses now, read from
// its control group (pkgtool/package_cgroup.h), for administrators. Version 1.
//
//   list  every installed package: {"packages": [<usage>...], "total"}
//   get   one package, parameter "id": <usage>
//
// <usage> is {"id", "cpu_ns", "memory_bytes", "memory_limit_bytes",
// "process_limit", "confinement"}, each figure {"measured": true, "value":
// <number>} or {"measured": false, "reason": <text>}: a figure the kernel
// cannot give (no controller, the package has not run since the start) is
// never 0. "confinement" is the package's confinement record as its scripts
// last wrote it (pkgtool/package_confinement.h), or null when it has none.
// Reading changes nothing, so it is not recorded in the activity log.
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// The codes of this API besides the host's (100 to 120); docs/error-codes.md.
enum UsageAPIError : int {
  kErrUsageNotInstalled = 4616,  // the package is not installed
};

// Each answers one method; the caller is an administrator already.
void UsageList(const APIRequest& request, APIResponse* response);
void UsageGet(const APIRequest& request, APIResponse* response);
