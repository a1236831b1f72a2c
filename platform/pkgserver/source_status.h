// How fresh each package server's catalogue is: per source address (the
// vendor's catalogue or a feed), when it was last fetched successfully and,
// while its fetches fail, since when and why, in words. Every fetch of a
// catalogue from its server records its outcome here (catalogue.cc), whoever
// asked for it: a listing, the feed probe, the update badge, kivoctl.
//
// One small JSON file per address under
// "/var/cache/kivo/pkgserver/sources/" (named by a hash of the address),
// replaced atomically under one lock file beside them: a reader sees a whole
// record, and two fetches that end at once are applied one after the other.
// A record is a cache's companion: when it is missing (a new feed, a cleared
// cache) the source has simply not been fetched since.
#pragma once

#include <cstdint>
#include <string>

#include <json/value.h>

namespace KIVOPackageServer {

struct SourceStatus {
  bool known = false;         // a fetch of this address is on record
  int64_t last_attempt = 0;   // unix seconds of the latest fetch
  int64_t last_success = 0;   // of the latest successful one; 0: none on record
  int64_t failing_since = 0;  // of the first failure after it; 0: the latest worked
  std::string error;          // why the latest fetch failed, in words ("" when it worked)
  int64_t packages = -1;      // entries the catalogue listed at its latest success; -1 unknown
};

// Records a successful fetch of `url` at `now` that lists `packages` entries
// (-1: unknown, such as an unchanged catalogue, whose earlier count is kept).
void PMSRecordFetchSuccess(const std::string& url, int64_t packages, int64_t now);

// Records a failed fetch of `url` at `now`, and why (`reason`, in words).
void PMSRecordFetchFailure(const std::string& url, const std::string& reason, int64_t now);

// The record of `url`; `known` is false when none is on record. False (with
// nothing filled) only when a record exists and cannot be read.
[[nodiscard]] bool PMSReadSourceStatus(const std::string& url, SourceStatus* status);

// Drops the record of `url` (a deleted feed's).
void PMSForgetSourceStatus(const std::string& url);

// The record as the answers carry it: {"last_attempt", "last_success",
// "failing_since", "error", "packages"}, times in unix seconds and null when
// not on record, "packages" null when unknown.
Json::Value PMSSourceStatusJson(const SourceStatus& status);

}  // namespace KIVOPackageServer
