// Words the module shares about an installed package that it answers in
// more than one place (the list and get, an upload's description, the
// catalogue): the status of one that does not run, and the host its own web
// page is reached at.
#pragma once

#include <string>

namespace KIVO_PACKAGE {

// The status the package tool's last result gives a package that does not
// run: "non_installed", "NA", "broken", "version_limit", "builtin",
// "non_support", or "stop".
const char* StoppedStatus(int result);

// The host the browser reached this appliance at (HTTP_HOST) without its
// port, which is the web API's and not the package's: "nas.local:5000" ->
// "nas.local", "[::1]:5000" -> "[::1]". At most 255 bytes.
std::string RequestHost();

}  // namespace KIVO_PACKAGE
