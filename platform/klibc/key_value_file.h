// Key/value files: the appliance's plain configuration format, one setting a
// line as  key="value". Blank lines and lines starting with '#' are comments
// and survive a rewrite. Inside the quotes, \" and \\ stand for " and \; a
// value never spans lines. A line without quotes (key=value) is read too.
//
// Writers replace the whole file atomically (temporary file + rename) under an
// advisory lock on "<file>.lock", so concurrent writers never lose each
// other's keys and readers never see half a file.
#pragma once

#include <map>
#include <string>

using KeyValueMap = std::map<std::string, std::string>;

// Reads every key of `path` into `*out` (a later line wins over an earlier one).
// Returns false and sets the last error when the file cannot be read.
[[nodiscard]] bool KIVOKeyValueLoad(const std::string& path, KeyValueMap* out);

// Parses key/value text (the content of such a file).
KeyValueMap KIVOKeyValueParse(const std::string& text);

// Sets `key` to `value` in `path`, creating the file when missing and keeping
// every other line as it was. Keys are [A-Za-z0-9_.-]+; values hold no newline.
// Returns false and sets the last error on bad input or a failed write.
[[nodiscard]] bool KIVOKeyValueSet(const std::string& path, const std::string& key,
                                   const std::string& value);

// Formats one line, quoting and escaping the value.
std::string KIVOKeyValueLine(const std::string& key, const std::string& value);

// The C-style calls the module uses.
//
// Copies the value of `key` into `buf` (NUL-terminated, cut to size - 1).
// Returns the length copied (so > 0 when a non-empty value was read), 0 when
// the key is missing or empty, -1 when the file cannot be read.
[[nodiscard]] int KLIBCFileGetKeyValue(const char* file, const char* key, char* buf, int size,
                                       int flags);
// 1 when `key` holds exactly `value`, 0 when not, -1 when the file cannot be read.
[[nodiscard]] int KLIBCFileCheckKeyValue(const char* file, const char* key, const char* value,
                                         int flags);
// Sets a key of the platform's own settings file "/etc/kivoinfo.conf" (under
// the system root). 0 on success, -1 on failure with the last error set.
[[nodiscard]] int KLIBCINFOSetKeyValue(const char* key, const char* value);
