// The signing keys that a feed publishes in its catalogue's "keyrings",
// kept for that feed alone under "/usr/kivo/etc/packages/feed_keys" (one
// file per feed, named by a hash of its address). They vouch only for
// packages downloaded from that feed; the appliance keyring never holds them.
#pragma once

#include <string>
#include <vector>

#include <json/value.h>

namespace KIVOPackageServer {

// Stores `keys` (an array of armored OpenPGP public key blocks) as the keys
// of `feed`, replacing what it had; a null or empty value removes them.
// Elements that are not one armored public key block (a secret key, text,
// a number) are refused with a log line and not stored. False (logged) when
// the address is empty or the file cannot be written or removed; the
// previous keys then stay as they were.
[[nodiscard]] bool PMSUpdatePkgServerKey(const std::string& feed, const Json::Value& keys);

// The stored keys of `feed` (armored public key blocks); empty when none.
std::vector<std::string> PMSFeedKeys(const std::string& feed);

// True when `text` is exactly one armored OpenPGP public key block whose
// packets are public keys and nothing secret (whether the key is usable is
// gpgme's to say when it imports it).
bool PMSIsArmoredPublicKey(const std::string& text);

}  // namespace KIVOPackageServer
