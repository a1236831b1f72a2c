// One package's record on a package server, for a download.
#pragma once

#include <string>

#include <json/value.h>

#include "pkgtool/package_info.h"

namespace KIVOPackageServer {

// The catalogue entry of `name` (vendor's server when isKivo, else the
// feeds) with at least "link"; "md5", "sha256", "size" and "type" when the
// catalogue gives them. False when no catalogue has it or it has no usable
// link.
bool GetPackageInfoFromServer(const std::string& name, Json::Value& record, bool isKivo,
                              const std::string& language);

// For an installed package: the vendor's record of the same package into
// `info` ("link", "checksum", "size", "type"). False when the vendor's
// catalogue has no usable entry for it.
bool PMSGetPkgFromServer(const std::string& language, PackageInfo& info);

}  // namespace KIVOPackageServer
