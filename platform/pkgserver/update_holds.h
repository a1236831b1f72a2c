// Holds on automatic updates: an administrator keeps a package at its
// installed version, until a date or until the hold is lifted. `kivoctl
// auto-update` skips a held package; upgrades by hand are not held.
//
// They live in the root's "usr/kivo/etc/packages/autoupdate-holds.json":
//
//   {"demo-web": {"until": "2024-06-01", "since": 1714532400, "by": "admin"},
//    "demo-db":  {"until": null, "since": 1714532400, "by": "admin"}}
//
// `until` is a date (YYYY-MM-DD) in the appliance's local time: the hold
// ends as that day begins; null holds until lifted. `since` is when it was
// set (seconds since the epoch) and `by` the account that set it. The file
// is written atomically under "autoupdate-holds.json.lock" and checked
// whole when read: one entry that breaks a rule makes the whole file
// unreadable, and a run then upgrades nothing rather than a held package.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include <json/value.h>

namespace KIVOPackageServer {

struct UpdateHold {
  std::string until;  // "YYYY-MM-DD", or "" until lifted
  int64_t since = 0;
  std::string by;
};
// Package id -> its hold.
using UpdateHolds = std::map<std::string, UpdateHold>;

// Whether `text` is a date of the calendar as YYYY-MM-DD (years 2000 to
// 9999).
bool IsHoldDate(const std::string& text);

// When a hold until `date` (IsHoldDate) ends: the local midnight that
// begins it.
int64_t HoldEnds(const std::string& date);

// Whether `hold` still holds at `now`.
bool HoldHolds(const UpdateHold& hold, int64_t now);

// "until 2024-06-01" or "until lifted".
std::string HoldText(const UpdateHold& hold);

// The stored holds, expired ones too. A missing file holds nothing. False
// when the file cannot be read or fails a check (*out is then empty).
[[nodiscard]] bool ReadHolds(UpdateHolds* out);

// Holds package `id` (PMSIsValidPackageId) as `hold` says, replacing any
// earlier hold of it, and drops the holds that ended before `now`; a damaged
// file is replaced. False (the last error set) when the hold breaks a rule
// or the file cannot be written.
[[nodiscard]] bool SetHold(const std::string& id, const UpdateHold& hold, int64_t now);

// Lifts the hold of `id`, if any, and drops the holds that ended before
// `now`. *lifted tells whether there was one. False when the file cannot be
// written.
[[nodiscard]] bool LiftHold(const std::string& id, int64_t now, bool* lifted);

// {"until": date or null, "since", "by", "active"} as the web API answers.
Json::Value UpdateHoldJson(const UpdateHold& hold, int64_t now);

}  // namespace KIVOPackageServer
