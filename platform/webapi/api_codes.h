// The answer codes any web API call may get, whoever serves it: the host's
// refusals before a handler runs, and the parameter fault that the host's
// checks and every module's checkers answer alike. A module's own codes are
// its own (package/error_codes.h); docs/http-api.md gives each its meaning.
#pragma once

enum WebAPIError : int {
  kErrUnknown = 100,     // no answer was set, or the method failed unexpectedly
  kErrBadRequest = 101,  // no api, method or version, or a malformed request
  kErrNoSuchAPI = 102,
  kErrNoSuchMethod = 103,
  kErrBadVersion = 104,
  kErrNotPermitted = 105,
  kErrSessionExpired = 106,
  kErrNotSignedIn = 119,
  kErrParameter = 120,  // {"name", "reason"}: "required", "type" or "condition"
};
