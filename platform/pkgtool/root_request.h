// Packages that ask to run as root. Such a package's scripts and service
// run with the appliance's full rights, unconfined: only the
// administrator's own trust may grant that. So it is accepted only when it
// is signed by a key of the appliance keyring. A feed's keys vouch for what
// that feed publishes, never for control of the appliance, and neither a
// trust level nor the administrator's "install it anyway" stands in for
// the signature.
#pragma once

#include <string>

#include "pkgtool/package_info.h"

// The INFO key by which a package asks to run as root ("yes"; docs/package-format.md).
inline constexpr char kPMSRunAsRootKey[] = "run_as_root";

// Whether `info` asks to run as root.
inline bool PMSAsksForRoot(const PackageInfo& info) { return info.getBool(kPMSRunAsRootKey); }

// The rule, for the package file check and for every install and upgrade:
// PKG_OK when `info` does not ask for root, or when its signature verified
// (`outcome`, PMSCheckSignature's, PKG_OK) by a key of the appliance keyring
// (`voucher` kPMSKeyringVoucher). Otherwise PKG_ERR_ROOT_NOT_TRUSTED, with
// `*message` saying what the signature check found instead.
[[nodiscard]] int PMSCheckRootSigner(const PackageInfo& info, int outcome,
                                     const std::string& voucher, std::string* message);
