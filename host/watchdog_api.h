// "KIVO.Core.Package.Watchdog": what the watchdog (`kivoctl watchdog`) did
// to each installed package, for administrators, answered by the host
// beside the module. Version 1.
//
//   list    {"packages": [{"id", "restarts_last_hour", "crashed": null or
//           {"time" (ms since the epoch), "restarts", "reason", "log"}}]}
//           for every installed package, sorted by id; takes no parameter
//
// It only reads: a package the watchdog gave up on is started again through
// the module's Control start, which clears the mark.
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// Answers list; the caller is an administrator already.
void WatchdogList(const APIRequest& request, APIResponse* response);
