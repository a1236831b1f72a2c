// The system root: every fixed path of the appliance ("/etc/kivoinfo.conf",
// "/usr/kivo/...", "/volume1", the package registry) lives under it.
//
// On an appliance the root is "/". The demo and every test point KIVO_ROOT at
// a directory of their own, so that they never touch the machine and can run
// side by side.
#pragma once

#include <string>

// The root directory, without a trailing slash ("" stands for "/").
// Read from the environment variable KIVO_ROOT on every call, so a forked
// worker or a test that changes it sees the new value.
std::string KIVOSysRoot();

// Resolves a fixed appliance path under the system root:
// KIVORootPath("/etc/kivoinfo.conf") is "<root>/etc/kivoinfo.conf".
// `fixed` must be absolute; a relative one is taken as relative to the root.
std::string KIVORootPath(const std::string& fixed);
