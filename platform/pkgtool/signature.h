// Code signatures of package files: a detached OpenPGP signature over the
// package's MANIFEST, checked with gpgme against the appliance keyring
// ("/usr/kivo/etc/packages/gnupg" under the system root, the keyring the
// code-signing script manages).
#pragma once

#include <string>
#include <vector>

// How strict the appliance is ("pkg_source_trust_level" in
// /etc/kivoinfo.conf):
//   0  only packages signed by a key of the appliance keyring;
//   1  those, and unsigned packages;
//   2  any package whose signature, if it has one, is intact (unknown and
//      expired signers are accepted; a revoked key never is).
enum PKG_TRUST_LEVEL { PKG_TRUST_KEYRING = 0, PKG_TRUST_UNSIGNED = 1, PKG_TRUST_ANY = 2 };

// The trust level the appliance's settings name (0 when unset or unreadable).
int PMSTrustLevel();

// Keys that vouch for one package besides the appliance keyring: those a
// feed publishes, for a package downloaded from that feed and nothing else.
struct PMSSourceKeys {
  std::string source;             // who vouches: the feed's address
  std::vector<std::string> keys;  // armored OpenPGP public key blocks
};

// The name a check gives the appliance keyring as the voucher.
constexpr const char* kPMSKeyringVoucher = "appliance keyring";

// The outcome of checking one signature, before any trust level applies:
// PKG_OK (good, by a key of the keyring), PKG_ERR_NO_SIGNATURE,
// PKG_ERR_BAD_SIGNATURE (tampered, or a signature file that holds no
// signature), PKG_ERR_UNKNOWN_SIGNER, PKG_ERR_EXPIRED_KEY,
// PKG_ERR_REVOKED_KEY, or PKG_ERR_SIGNATURE_UNCHECKABLE.
// `*signer` gets the key's fingerprint when one was named.
//
// With `source_keys` (not null, with keys), a signer the appliance keyring
// does not know is looked up among those keys: they are imported into a
// scratch GnuPG home under the root's tmp/ for this check alone and removed
// with it, so the appliance keyring never holds them. `*voucher` (when not
// null) gets who vouched for a good signature: kPMSKeyringVoucher or the
// source's name; "" otherwise.
[[nodiscard]] int PMSCheckSignature(const std::string& data, const std::string& signature,
                                    std::string* signer, std::string* error,
                                    const PMSSourceKeys* source_keys = nullptr,
                                    std::string* voucher = nullptr);

// Whether the administrator confirmed installing a package whose signature
// the trust level would otherwise refuse (the page's "Install it anyway",
// kivoctl's --no-codesign).
enum class SignatureConfirmed { No, Yes };

// Applies the trust level to an outcome: PKG_OK when the package may be used.
// The level binds whatever the caller asks: at PKG_TRUST_KEYRING nothing but
// a good signature by a trusted key passes. Above it, a confirmation lets an
// unsigned package or one of an unknown or expired signer through. A bad
// signature, a revoked key and a signature that cannot be checked pass never.
[[nodiscard]] int PMSApplyTrustLevel(int outcome, int trust_level,
                                     SignatureConfirmed confirmed = SignatureConfirmed::No);

// Signs `data` with `key` (fingerprint, id or user id) of the keyring in
// `gnupg_home`; *signature gets an armored detached signature.
[[nodiscard]] bool PMSSignData(const std::string& gnupg_home, const std::string& key,
                               const std::string& data, std::string* signature, std::string* error);

// The appliance keyring's folder.
std::string PMSKeyringHome();
