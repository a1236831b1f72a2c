// What an armored OpenPGP key block holds, judged by its packets. The words
// of an armor header are the sender's to choose: a secret key sent under
// "BEGIN PGP PUBLIC KEY BLOCK" is still a secret key, and storing it as a
// feed's public key would keep the secret on the appliance.
#pragma once

#include <string_view>

namespace KIVOPackageServer {

enum class KeyBlockContent {
  kPublicKey,  // a public key with its user ids, subkeys and signatures
  kSecretKey,  // holds a secret key or secret subkey packet
  kNotAKey,    // no armor, bad base64, cut-short packets, or other packets
};

// Decodes the armored block `text` (one block, headers and checksum line
// allowed) and walks its packets. Public keys are public-key packets, the
// first packet among them, with only user ids, user attributes, public
// subkeys, signatures and trust packets besides.
KeyBlockContent PMSKeyBlockContent(std::string_view text);

}  // namespace KIVOPackageServer
