// The checks of a package against this appliance that both the package
// file check and the install make.
#pragma once

#include <string>

#include <json/value.h>

#include "pkgtool/package_info.h"
#include "storage/volumes.h"

// Architecture, OS version limits, conflicts, required services and
// packages, port. Returns PKG_OK or the code, with `message` and `details`
// ("instPackageList", "serviceNoStarted", "packages", "unStartPkgList",
// "deppkg"). `arch_code` is the code for a foreign architecture (281 for a
// file check, 264 for an install).
int PMSCheckPackageFits(const PackageInfo& info, int arch_code, std::string* message,
                        Json::Value* details);

// The room an install of `info` needs: its INFO "extractsize" (KiB, which
// the builder records), or twice the compressed payload when it has none.
uint64_t PMSNeededBytes(const PackageInfo& info, uint64_t payload_size);

// Picks the volume to install `info` on: `requested` when given, else the
// volume of the installed version, else the default volume, else the first
// usable one. Returns PKG_OK, 297 (none), 296 (crashed) or 279 (too little
// room for `needed_bytes`).
int PMSChooseVolume(const PackageInfo& info, const std::string& requested, uint64_t needed_bytes,
                    VolumeConfig* out, std::string* message);
