// Whether a system service runs, as configured under the system root. This
// file stands in for the service manager, which is not part of the package
// center:
//
//   /etc/kivo/services.conf pgsql="running" web="running" ssh="stopped"
#pragma once

#include <string>

// True when services.conf says the system service `name` is "running". A
// service it does not name, or a missing or unreadable file, is not running:
// a package that needs it must not start on a guess.
bool KIVOServiceRunning(const std::string& name);
