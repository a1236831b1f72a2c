// OpenPGP keys for signature tests, made with the gpg command in a folder
// of the test's own: good, expired and revoked publisher keys.
#pragma once

#include <string>

// An armored secret key block relabelled as a public one: the header's
// words changed, the packets not.
std::string InPublicArmor(std::string secret_block);

class TestKeys {
 public:
  // Makes a GnuPG home in `dir`.
  explicit TestKeys(const std::string& dir);

  // Creates a signing key for `uid`; with `expired` it was valid for one day
  // in 2020. Returns its fingerprint.
  std::string Create(const std::string& uid, bool expired = false);
  // `fpr` exported as an armored block: its public key, or with `secret`
  // its secret key (the keys here have no passphrase).
  std::string Export(const std::string& fpr, bool secret = false) const;
  // Revokes `fpr` (its revocation certificate, imported here and exported
  // to the appliance keyring by Trust).
  void Revoke(const std::string& fpr);
  // Imports the public key (and any revocation) into the system root's keyring.
  void Trust(const std::string& fpr) const;
  // Signs the package file in place with `fpr`, as `kivoctl sign` does;
  // expired keys sign at a time they were valid.
  void Sign(const std::string& package, const std::string& fpr, bool expired = false) const;
  const std::string& home() const { return home_; }

 private:
  std::string home_;
};
