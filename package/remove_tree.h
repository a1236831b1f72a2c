// Deleting a temporary file or folder of the module (an upload, a download
// folder): always "/bin/rm -rf" through the platform's exec call.
#pragma once

#include <string>

namespace KIVO_PACKAGE {

// Removes `path` recursively. Does nothing for an empty path or one holding
// a NUL byte (it would name something else once cut short). False, with a
// log line, when rm failed; the caller's answer does not depend on it (the
// file is temporary and swept later), so it may go on.
bool RemoveTree(const std::string& path);

}  // namespace KIVO_PACKAGE
