// kivoctl confine ID: gives an installed package its own account now (one
// installed before packages had accounts gets it at its next start or
// upgrade otherwise), hands it its data folder, and prints the package's
// confinement record (platform/pkgtool/package_confinement.h). Exit status
// 0, or 1 with the package tool's result code in brackets.
#pragma once

#include <string>
#include <vector>

int KivoctlConfine(const std::vector<std::string>& args);
