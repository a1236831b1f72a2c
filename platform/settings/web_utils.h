// JSON files shared between processes (the feed list, per-user settings).
#pragma once

#include <string>

#include <json/value.h>

namespace WebUtils {

// Reads and parses `path` into `*out`. Returns false (with *out null and the
// last error set) when the file is missing, unreadable or not valid JSON.
bool LoadJsonFile(const std::string& path, Json::Value& out);

// Writes `value` to `path` atomically (temporary file + rename), creating the
// parent folder when missing. Returns false with the last error set on failure;
// the old file is then left as it was.
bool SaveJsonFile(const std::string& path, const Json::Value& value);

}  // namespace WebUtils
