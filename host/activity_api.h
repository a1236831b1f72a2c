// "KIVO.Core.Package.Activity": the activity log (platform/activity) for
// administrators, answered by the host beside the module. Version 1.
//
//   list    the entries that match the filters, newest first:
//           {"entries": [...], "total", "offset", "limit"}
//   export  the same entries, all of them, as a file to download:
//           format "csv" (default) or "json"
//
// Filters, each optional: package (a package id), account, operation
// ("Control.start", "sign-in", ...), outcome ("success", "failure",
// "unfinished", "running"), since and until (ms since the epoch, on the
// start time). list also takes offset (from 0) and limit (1 to 500,
// default 50). A value that breaks these rules answers 120 naming it.
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// Answers list or export; the caller is an administrator already.
void ActivityList(const APIRequest& request, APIResponse* response);
void ActivityExport(const APIRequest& request, APIResponse* response);
