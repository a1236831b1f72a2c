// "KIVO.Core.Package.Revision": the earlier versions that upgrades keep
// (pkgtool/revisions.h), rolling back to them and dropping them, for
// administrators, answered by the host beside the module. Version 1.
//
//   list      per package: the installed version, the kept earlier versions
//             (version, when replaced, the room they take), the version an
//             automatic update failed to install and will not try again,
//             and the last rollback's progress or outcome. `id` (optional)
//             names one package; without it, every installed package that
//             has any of these.
//   rollback  `id`: rolls the package back to its most recently replaced
//             version in a worker of its own, which outlives the request
//             and the client; answers {"task_id", "rollback"} once the
//             worker runs. The package tool's lock orders it with every
//             other package operation.
//   drop      `id`: removes the kept versions of the package and their data.
//
// A rollback's task ("@KIVOPKG_ROLLBACK_<id>", taskmgr/task_names.h) holds
// its progress and outcome in "data" until the next rollback of the same
// package replaces it, so a reloaded page finds how it went.
#pragma once

#include <string>

#include "webapi/api_request.h"
#include "webapi/api_response.h"

// The codes of this API besides the host's (100 to 120); docs/error-codes.md.
enum RevisionAPIError : int {
  kErrNoRevision = 4610,            // no earlier version of the package is kept
  kErrRevisionBusy = 4611,          // another operation holds the package tool or the package
  kErrRollbackFailed = 4612,        // the rollback failed (the message says where it stands)
  kErrDropFailed = 4613,            // some of the kept version stays
  kErrRevisionNotInstalled = 4614,  // the package is not installed
};

// Each answers one method; the caller is an administrator already, signed in
// as `account`. rollback and drop record themselves in the activity log: a
// refusal by the request, an accepted rollback by its worker with the
// outcome.
void RevisionList(const APIRequest& request, APIResponse* response);
void RevisionRollback(const APIRequest& request, const std::string& account, APIResponse* response);
void RevisionDrop(const APIRequest& request, const std::string& account, APIResponse* response);
