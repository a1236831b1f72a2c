// Operating system versions as the appliance writes them, "7.2-0064":
// major.minor-build, each a decimal number.
#pragma once

#include <string>

// "7.2-0064" -> 7, 2, 64. False when `text` is not such a version; the
// outputs are then unspecified.
[[nodiscard]] bool KIVOParseOSVersion(const std::string& text, int* major, int* minor, int* build);

// <0, 0, >0 comparing two versions as (major, minor, build). A malformed
// version compares as 0.0-0, below every real one.
int KIVOCompareOSVersion(const std::string& a, const std::string& b);
