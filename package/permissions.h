// What a package file will be allowed to do once installed, for the page
// to show before an install or upgrade (docs/http-api.md, "Fields of our
// own"): whether it runs as root or as its own user, the limits its INFO
// declares, and who signed it.
#pragma once

#include <json/value.h>

#include "pkgtool/package_info.h"

namespace KIVO_PACKAGE {

// {"run_as_root": bool, "memory_limit_mb": text, "process_limit": text,
// "signature": text}: the limits only when INFO declares them (the
// appliance's defaults apply otherwise), "signature" only when the package
// tool's check gave its line (`details`' "signature").
Json::Value DescribePermissions(const PackageInfo& info, const Json::Value& details);

}  // namespace KIVO_PACKAGE
