#include "log_line.h"

#include <cstring>

namespace KIVO_PACKAGE {

std::string LogSourceName(const char* file) {
  const char* base = strrchr(file, '/');
  base = base ? base + 1 : file;
  return std::string(base, strcspn(base, "."));
}

}  // namespace KIVO_PACKAGE
