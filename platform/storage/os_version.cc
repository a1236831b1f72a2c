#include "storage/os_version.h"

#include <cstdio>

bool KIVOParseOSVersion(const std::string& text, int* major, int* minor, int* build) {
  char tail;
  return sscanf(text.c_str(), "%d.%d-%d%c", major, minor, build, &tail) == 3;
}

int KIVOCompareOSVersion(const std::string& a, const std::string& b) {
  int a1 = 0, a2 = 0, a3 = 0, b1 = 0, b2 = 0, b3 = 0;
  if (!KIVOParseOSVersion(a, &a1, &a2, &a3)) a1 = a2 = a3 = 0;
  if (!KIVOParseOSVersion(b, &b1, &b2, &b3)) b1 = b2 = b3 = 0;
  if (a1 != b1) return a1 < b1 ? -1 : 1;
  if (a2 != b2) return a2 < b2 ? -1 : 1;
  if (a3 != b3) return a3 < b3 ? -1 : 1;
  return 0;
}
