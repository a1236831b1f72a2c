// Rendering a package as the JSON object that list, get, upload and the
// server catalogue answer with: the base members and the optional members a
// caller asks for by name in "additional".
#pragma once

#include <cstdint>
#include <string>

#include <json/value.h>

#include "pkgtool/package_info.h"

namespace PackageUtils {

// Bits of the additional mask, one per name a caller may ask for.
enum AdditionalBit : uint64_t {
  kDescription = 0x1,
  kDescriptionEnu = 0x2,
  kBeta = 0x4,
  kDistributor = 0x8,
  kDistributorUrl = 0x10,
  kMaintainer = 0x20,
  kMaintainerUrl = 0x40,
  kNvxApps = 0x80,
  kHelpUrl = 0x100,
  kReportBetaUrl = 0x200,
  kStartable = 0x400,
  kSupportUrl = 0x800,
  kInstallReboot = 0x1000,
  kUrl = 0x2000,
  kStatus = 0x4000,
  kInstalledInfo = 0x8000,
  kIsUninstallPages = 0x10000,
  kUninstallPages = 0x20000,
  kSilentInstall = 0x40000,
  kSilentUpgrade = 0x80000,
  kSilentUninstall = 0x100000,
  kInstallType = 0x200000,
  kAutoupdate = 0x400000,
  kSupportCenter = 0x800000,
  kDependentPackages = 0x1000000,
  kStartDependentServices = 0x2000000,
  kInstallingProgress = 0x4000000,
  kCtlUninstall = 0x100000000ULL,
  kLogPath = 0x200000000ULL,
};

// The mask of the names in `names` (compared ignoring case); unknown names
// and non-strings add nothing.
uint64_t ParseAdditional(const Json::Value& names);

// Whether `name` is one of those names as it is spelt. The checkers of list
// and get take only these; a handler reached without them (the legacy list)
// takes any case.
bool IsAdditionalName(const std::string& name);

// Writes "id", "version", "name"; with a mask, also "additional" (kept and
// added to when `out` already has one) through DumpAdditionalInfo.
void DumpInfo(const PackageInfo& info, uint64_t mask, Json::Value& out);

// The optional members of the record itself, each when its bit is set.
void DumpAdditionalInfo(const PackageInfo& info, uint64_t mask, Json::Value& additional);

// out["licence"] = the URL-encoded licence text, when there is one.
void DumpLicense(const PackageInfo& info, Json::Value& out);

// out = the URL-encoded JSON text of the record's wizard description, when
// one is loaded.
void DumpUIFIle(const PackageInfo& info, Json::Value& out);

}  // namespace PackageUtils
