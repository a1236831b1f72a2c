// "KIVO.Core.Package.Sources": how fresh the catalogue is, per source, for
// administrators; answered by the host beside the module. Version 1.
//
//   list    {"now": unix seconds, "sources": [SOURCE, ...]}: the vendor's
//           server first, then each listed feed in the feed list's order
//
// A SOURCE is {"kind": "vendor" | "feed", "url", "name", "state",
// "last_attempt", "last_success", "failing_since", "error", "packages"}:
// "state" is "ok" (its latest fetch worked), "failing" (it failed;
// "failing_since" and "error" say since when and why) or "unknown" (no
// fetch on record); times are unix seconds or null, "packages" the entries
// listed at the latest success (null when unknown). The vendor's entry has
// url "" and state "unconfigured" when pkgserver.conf names no server.
// Nothing is fetched: "Server" "list" with blforcereload fetches again.
#pragma once

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// Answers list; the caller is an administrator already.
void SourcesList(const APIRequest& request, APIResponse* response);
