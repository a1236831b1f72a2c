#include "klibc/sysroot.h"

#include <cstdlib>

std::string KIVOSysRoot() {
  const char* env = std::getenv("KIVO_ROOT");
  std::string root = env ? env : "";
  while (!root.empty() && root.back() == '/') root.pop_back();
  return root;
}

std::string KIVORootPath(const std::string& fixed) {
  std::string root = KIVOSysRoot();
  if (fixed.empty() || fixed[0] != '/') return root + "/" + fixed;
  return root + fixed;
}
