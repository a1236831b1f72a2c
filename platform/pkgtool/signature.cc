#include "pkgtool/signature.h"

#include <cstdlib>

#include <gpgme.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/result_codes.h"

namespace {

// A gpgme context on one keyring folder; released with the object.
class GpgContext {
 public:
  explicit GpgContext(const std::string& home) {
    gpgme_check_version(nullptr);
    if (gpgme_new(&ctx_) != 0) {
      ctx_ = nullptr;
      return;
    }
    gpgme_set_armor(ctx_, 1);
    gpgme_ctx_set_engine_info(ctx_, GPGME_PROTOCOL_OpenPGP, nullptr, home.c_str());
  }
  ~GpgContext() {
    if (ctx_) gpgme_release(ctx_);
  }
  GpgContext(const GpgContext&) = delete;
  GpgContext& operator=(const GpgContext&) = delete;
  gpgme_ctx_t get() const { return ctx_; }

 private:
  gpgme_ctx_t ctx_ = nullptr;
};

// Memory-backed gpgme data, released with the object.
class GpgData {
 public:
  GpgData() { gpgme_data_new(&data_); }
  explicit GpgData(const std::string& bytes) {
    gpgme_data_new_from_mem(&data_, bytes.data(), bytes.size(), 1);
  }
  ~GpgData() {
    if (data_) gpgme_data_release(data_);
  }
  GpgData(const GpgData&) = delete;
  GpgData& operator=(const GpgData&) = delete;
  gpgme_data_t get() const { return data_; }
  std::string Take() {
    size_t size = 0;
    char* buf = gpgme_data_release_and_get_mem(data_, &size);
    data_ = nullptr;
    std::string out(buf ? buf : "", buf ? size : 0);
    gpgme_free(buf);
    return out;
  }

 private:
  gpgme_data_t data_ = nullptr;
};

int OutcomeOf(gpgme_signature_t sig) {
  gpgme_err_code_t status = gpgme_err_code(sig->status);
  if (sig->summary & GPGME_SIGSUM_KEY_REVOKED || status == GPG_ERR_CERT_REVOKED) {
    return PKG_ERR_REVOKED_KEY;
  }
  if (status == GPG_ERR_BAD_SIGNATURE || sig->summary & GPGME_SIGSUM_RED)
    return PKG_ERR_BAD_SIGNATURE;
  if (status == GPG_ERR_NO_PUBKEY || sig->summary & GPGME_SIGSUM_KEY_MISSING) {
    return PKG_ERR_UNKNOWN_SIGNER;
  }
  if (status == GPG_ERR_KEY_EXPIRED || status == GPG_ERR_SIG_EXPIRED ||
      sig->summary & (GPGME_SIGSUM_KEY_EXPIRED | GPGME_SIGSUM_SIG_EXPIRED)) {
    return PKG_ERR_EXPIRED_KEY;
  }
  return status == GPG_ERR_NO_ERROR ? PKG_OK : PKG_ERR_BAD_SIGNATURE;
}

}  // namespace

std::string PMSKeyringHome() { return KIVORootPath("/usr/kivo/etc/packages/gnupg"); }

int PMSTrustLevel() {
  KeyValueMap conf;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivoinfo.conf"), &conf)) return PKG_TRUST_KEYRING;
  int level = std::atoi(conf["pkg_source_trust_level"].c_str());
  return level >= PKG_TRUST_KEYRING && level <= PKG_TRUST_ANY ? level : PKG_TRUST_KEYRING;
}

int PMSCheckSignature(const std::string& data, const std::string& signature, std::string* signer,
                      std::string* error) {
  if (signature.empty()) return PKG_ERR_NO_SIGNATURE;
  std::string home = PMSKeyringHome();
  if (KIVOFSMkdirP(home.c_str(), 0700) != 0) {
    *error = "cannot make the keyring folder " + home;
    return PKG_ERR_SIGNATURE_UNCHECKABLE;
  }
  GpgContext ctx(home);
  if (!ctx.get()) {
    *error = "cannot start GnuPG";
    return PKG_ERR_SIGNATURE_UNCHECKABLE;
  }
  GpgData sig(signature), text(data);
  gpgme_error_t err = gpgme_op_verify(ctx.get(), sig.get(), text.get(), nullptr);
  gpgme_verify_result_t result = gpgme_op_verify_result(ctx.get());
  // A signature file that holds no signature is a bad signature, never a
  // good one.
  if (!result || !result->signatures) {
    *error = err ? gpgme_strerror(err) : "signature.asc holds no signature";
    return PKG_ERR_BAD_SIGNATURE;
  }
  gpgme_signature_t first = result->signatures;
  if (first->fpr) *signer = first->fpr;
  int outcome = OutcomeOf(first);
  if (outcome != PKG_OK) *error = gpgme_strerror(first->status);
  return outcome;
}

int PMSApplyTrustLevel(int outcome, int trust_level) {
  if (outcome == PKG_OK || outcome == PKG_ERR_SIGNATURE_UNCHECKABLE) return outcome;
  if (outcome == PKG_ERR_BAD_SIGNATURE || outcome == PKG_ERR_REVOKED_KEY) return outcome;
  if (outcome == PKG_ERR_NO_SIGNATURE && trust_level >= PKG_TRUST_UNSIGNED) return PKG_OK;
  if ((outcome == PKG_ERR_UNKNOWN_SIGNER || outcome == PKG_ERR_EXPIRED_KEY) &&
      trust_level >= PKG_TRUST_ANY) {
    return PKG_OK;
  }
  return outcome;
}

bool PMSSignData(const std::string& gnupg_home, const std::string& key, const std::string& data,
                 std::string* signature, std::string* error) {
  GpgContext ctx(gnupg_home);
  gpgme_key_t signing_key = nullptr;
  if (!ctx.get() || gpgme_get_key(ctx.get(), key.c_str(), &signing_key, 1) != 0) {
    *error = "no secret key " + key + " in " + gnupg_home;
    return false;
  }
  gpgme_signers_clear(ctx.get());
  gpgme_error_t added = gpgme_signers_add(ctx.get(), signing_key);
  gpgme_key_unref(signing_key);
  if (added) {
    *error = std::string("cannot sign with ") + key + ": " + gpgme_strerror(added);
    return false;
  }
  GpgData text(data), sig;
  gpgme_error_t err = gpgme_op_sign(ctx.get(), text.get(), sig.get(), GPGME_SIG_MODE_DETACH);
  if (err) {
    *error = std::string("signing failed: ") + gpgme_strerror(err);
    return false;
  }
  *signature = sig.Take();
  return true;
}
