#include "remove_tree.h"

#include "klibc/process.h"
#include "log_line.h"
#include "request_values.h"

namespace KIVO_PACKAGE {

bool RemoveTree(const std::string& path) {
  if (!IsCleanText(path)) return true;
  if (KLIBCExec("/bin/rm", "-rf", path.c_str(), nullptr, nullptr) == 0) return true;
  PKG_LOG_ERR("Failed to remove [%s]", path.c_str());
  return false;
}

}  // namespace KIVO_PACKAGE
