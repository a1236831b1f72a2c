#include "package_status.h"

#include <cstdlib>

#include "pkgtool/result_codes.h"

namespace KIVO_PACKAGE {

const char* StoppedStatus(int result) {
  switch (result) {
    case PKG_ERR_NOT_INSTALLED:
      return "non_installed";
    case PKG_ERR_STATUS_UNKNOWN:
    case PKG_ERR_REGISTRY:
      return "NA";
    case PKG_ERR_SIGNATURE_UNCHECKABLE:
    case PKG_ERR_BROKEN:
      return "broken";
    case PKG_ERR_VERSION_LIMIT:
      return "version_limit";
    case PKG_ERR_BUILTIN:
      return "builtin";
    case PKG_ERR_NOT_SUPPORTED:
      return "non_support";
    default:
      return "stop";
  }
}

std::string RequestHost() {
  const char* env = getenv("HTTP_HOST");
  std::string host = env ? std::string(env).substr(0, 255) : "";
  // The port follows the last colon, unless that colon is inside an IPv6
  // address's brackets.
  size_t colon = host.rfind(':');
  if (colon != std::string::npos && host.find(']', colon) == std::string::npos) host.resize(colon);
  return host;
}

}  // namespace KIVO_PACKAGE
