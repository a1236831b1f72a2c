#include "pkgtool/root_request.h"

#include "pkgtool/result_codes.h"
#include "pkgtool/signature.h"

namespace {

// What the signature check found, for a refusal's message: only what was
// checked, so a signer is named as trusted only when its signature verified.
std::string FoundSignature(int outcome, const std::string& voucher) {
  if (outcome == PKG_OK) return "its signature is vouched for by " + voucher + " only";
  if (outcome == PKG_ERR_NO_SIGNATURE) return "it is not signed";
  return std::string("its signature does not qualify: ") + PMSResultText(outcome);
}

}  // namespace

int PMSCheckRootSigner(const PackageInfo& info, int outcome, const std::string& voucher,
                       std::string* message) {
  if (!PMSAsksForRoot(info)) return PKG_OK;
  if (outcome == PKG_OK && voucher == kPMSKeyringVoucher) return PKG_OK;
  *message = info.getId() +
             " asks to run as root (run_as_root=\"yes\"), which only a package signed by a key "
             "of the appliance keyring may; " +
             FoundSignature(outcome, voucher);
  return PKG_ERR_ROOT_NOT_TRUSTED;
}
