#include "permissions.h"

#include "pkgtool/root_request.h"

namespace KIVO_PACKAGE {

Json::Value DescribePermissions(const PackageInfo& info, const Json::Value& details) {
  Json::Value out(Json::objectValue);
  out[kPMSRunAsRootKey] = PMSAsksForRoot(info);
  for (const char* key : {"memory_limit_mb", "process_limit"}) {
    const std::string value = info.get(key);
    if (!value.empty()) out[key] = value;
  }
  if (details.isObject() && details["signature"].isString())
    out["signature"] = details["signature"];
  return out;
}

}  // namespace KIVO_PACKAGE
