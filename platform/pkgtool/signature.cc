#include "pkgtool/signature.h"

#include <cstdlib>
#include <vector>

#include <gpgme.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/lifecycle.h"
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

// Verifies `signature` over `data` against the keyring in `home`.
int VerifyIn(const std::string& home, const std::string& data, const std::string& signature,
             std::string* signer, std::string* error) {
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

// A GnuPG home made for one check under the root's tmp/, removed with the
// object.
class ScratchHome {
 public:
  ScratchHome() = default;
  ~ScratchHome() {
    if (!path_.empty()) static_cast<void>(PMSRemoveTree(owner_, path_));
  }
  ScratchHome(const ScratchHome&) = delete;
  ScratchHome& operator=(const ScratchHome&) = delete;

  bool Make(std::string* error) {
    owner_ = KIVORootPath("/tmp");
    std::vector<char> name(owner_.begin(), owner_.end());
    const std::string pattern = "/source-keys-XXXXXX";
    name.insert(name.end(), pattern.begin(), pattern.end());
    name.push_back('\0');
    if (KIVOFSMkdirP(owner_.c_str(), 01777) != 0 || !mkdtemp(name.data())) {
      *error = "cannot make a scratch keyring under " + owner_;
      return false;
    }
    path_ = name.data();
    return true;
  }
  const std::string& path() const { return path_; }

 private:
  std::string owner_, path_;
};

// Imports armored public keys into the keyring in `home`. A block that
// imports nothing fails the whole check: the stored keys were public keys
// when the feed was added, so a block that is not one now is damage.
bool ImportKeys(const std::string& home, const std::vector<std::string>& keys, std::string* error) {
  GpgContext ctx(home);
  if (!ctx.get()) {
    *error = "cannot start GnuPG";
    return false;
  }
  for (const std::string& key : keys) {
    GpgData block(key);
    gpgme_error_t err = gpgme_op_import(ctx.get(), block.get());
    gpgme_import_result_t result = gpgme_op_import_result(ctx.get());
    if (err || !result || result->considered == 0 || result->secret_imported > 0) {
      *error = std::string("a key of the source cannot be imported: ") +
               (err ? gpgme_strerror(err) : "no public key in it");
      return false;
    }
  }
  return true;
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
                      std::string* error, const PMSSourceKeys* source_keys, std::string* voucher) {
  if (voucher) voucher->clear();
  if (signature.empty()) return PKG_ERR_NO_SIGNATURE;
  std::string home = PMSKeyringHome();
  if (KIVOFSMkdirP(home.c_str(), 0700) != 0) {
    *error = "cannot make the keyring folder " + home;
    return PKG_ERR_SIGNATURE_UNCHECKABLE;
  }
  int outcome = VerifyIn(home, data, signature, signer, error);
  if (outcome == PKG_OK) {
    if (voucher) *voucher = kPMSKeyringVoucher;
    return outcome;
  }
  // Only a signer the appliance keyring does not know may be vouched for by
  // the source: a key the administrator has (expired, revoked) keeps its
  // verdict, and a tampered file stays tampered.
  if (outcome != PKG_ERR_UNKNOWN_SIGNER || !source_keys || source_keys->keys.empty()) {
    return outcome;
  }
  ScratchHome scratch;
  if (!scratch.Make(error)) return PKG_ERR_SIGNATURE_UNCHECKABLE;
  if (!ImportKeys(scratch.path(), source_keys->keys, error)) return PKG_ERR_SIGNATURE_UNCHECKABLE;
  std::string source_error;
  int by_source = VerifyIn(scratch.path(), data, signature, signer, &source_error);
  if (by_source == PKG_ERR_UNKNOWN_SIGNER) return outcome;  // the first error stands
  *error = source_error;
  if (by_source == PKG_OK && voucher) *voucher = source_keys->source;
  return by_source;
}

int PMSApplyTrustLevel(int outcome, int trust_level, SignatureConfirmed confirmed) {
  if (outcome == PKG_OK || outcome == PKG_ERR_SIGNATURE_UNCHECKABLE) return outcome;
  if (outcome == PKG_ERR_BAD_SIGNATURE || outcome == PKG_ERR_REVOKED_KEY) return outcome;
  const bool unknown_signer = outcome == PKG_ERR_UNKNOWN_SIGNER || outcome == PKG_ERR_EXPIRED_KEY;
  if (outcome == PKG_ERR_NO_SIGNATURE && trust_level >= PKG_TRUST_UNSIGNED) return PKG_OK;
  if (unknown_signer && trust_level >= PKG_TRUST_ANY) return PKG_OK;
  // Levels above the strictest only warn: the administrator's confirmation
  // is the answer to that warning.
  if (confirmed == SignatureConfirmed::Yes && trust_level > PKG_TRUST_KEYRING &&
      (outcome == PKG_ERR_NO_SIGNATURE || unknown_signer)) {
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
