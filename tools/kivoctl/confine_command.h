// kivoctl confine ID: gives an installed package its own account now (one
// installed before packages had accounts gets it at its next start or
// upgrade otherwise), hands it its data folder, and prints the package's
// confinement record (platform/pkgtool/package_confinement.h). Exit status
// 0, or 1 with the package tool's result code in brackets.
#pragma once

#include <string>
#include <vector>

int KivoctlConfine(const std::vector<std::string>& args);

// kivoctl --root DIR drop-groups: removes every control group of the system
// root DIR, killing what still runs in them, for a root about to be removed
// (a test's, a demo's): the groups outlive the folder otherwise. Refused for
// the running system ("/"), whose packages it would kill. Exit status 0, 1
// when a group stays (saying which), 2 for a bad call.
int KivoctlDropGroups(const std::vector<std::string>& args);
