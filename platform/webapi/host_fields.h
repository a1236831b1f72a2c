// The request fields that only the host sets. When a multipart body carries a
// file, the host stores it and hands the handler its path as "<part>_tmp"
// ("file_tmp" for the package file) and its name as "file_name"; handlers read
// that path and delete the file afterwards. A field of such a name sent by a
// client, on any route a parameter can take (query string, urlencoded body,
// multipart field), would make a handler read or delete a file the client
// chose, so every reader refuses it.
#pragma once

#include <string>

// True for "file_name" and every name ending in "_tmp".
bool IsHostField(const std::string& name);
