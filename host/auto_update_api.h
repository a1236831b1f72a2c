// "KIVO.Core.Package.AutoUpdate": when automatic updates may run, which
// packages they leave alone, and how the last run went, for administrators,
// answered by the host beside the module. Version 1.
//
//   get      {"mode": "off"|"all"|"chosen", "window" (pkgserver/
//            update_window.h's form), "window_error" (null, or {"key",
//            "reason"} when the stored window is not valid), "holds" {id:
//            {"until", "since", "by", "active"}}, "last_run" (null, or
//            pkgserver/update_last_run.h's record), "now", "inside",
//            "already_ran", "next_run" (null, or {"opens", "closes"}); times
//            in seconds since the epoch}
//   set      the window, checked whole: `limited` (true/false), and when
//            true `days` (a JSON array of "mon".."sun", or "mon,tue"),
//            `start` and `end` ("HH:MM"); `random_delay_minutes` (0 to 720,
//            default 0). Answers as get.
//   hold     `id` (an installed package), `until` (YYYY-MM-DD, a day still
//            to come; absent or "" holds until lifted). Answers as get.
//   release  `id`: lifts its hold. Answers as get, with "lifted".
//
// A value that breaks a rule answers 120 naming the parameter (with
// "detail" in words) and stores nothing. set, hold and release are recorded
// in the activity log (host/activity_record.cc).
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// The codes of this API besides the host's (100 to 120); docs/error-codes.md.
enum AutoUpdateAPIError : int {
  kErrHoldNotInstalled = 4630,     // the package to hold is not installed
  kErrAutoUpdateNotStored = 4631,  // the window or the holds cannot be written
  kErrHoldsUnreadable = 4632,      // the stored holds cannot be read or fail a check
};

// Answers one method; the caller is an administrator already.
void AutoUpdateAnswer(const APIRequest& request, APIResponse* response);

// True for the methods this API serves.
bool IsAutoUpdateMethod(const std::string& method);
