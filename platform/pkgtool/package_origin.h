// Where an installed package came from and which key signed it, and the one
// rule that decides whether a package file may replace it.
//
// A package comes from the vendor's package server, from a feed (named by
// its address), or from a file (an upload, a path, a download that no
// catalogue lists). The install records that origin and the signer in the
// record member ORIGIN (registry.h), which no package file may hold, so a
// package cannot claim an origin of its own:
//
//   origin="vendor" | "feed" | "file"
//   feed="<address>"          (a feed's only)
//   signer="<fingerprint>"    "" when no verified key signed it
//
// A record without ORIGIN was written before origins were recorded. It is
// read as a file's whose signer is unknown: no catalogue offers it
// upgrades, and only a package signed by a key of the appliance keyring (or
// an explicit switch of its origin) replaces it.
#pragma once

#include <string>
#include <vector>

enum class PMSOriginKind { kVendor, kFeed, kFile };

struct PMSPackageOrigin {
  PMSOriginKind kind = PMSOriginKind::kFile;
  std::string feed;  // the feed's address (kFeed only)
  // The fingerprint of the key whose signature was verified, by the
  // appliance keyring or by the feed's keys; "" for an unsigned package and
  // for a signer nobody vouched for.
  std::string signer;
  // False for a record without ORIGIN (see above): its signer is unknown.
  bool recorded = true;

  static PMSPackageOrigin Vendor();
  static PMSPackageOrigin Feed(const std::string& address);
  static PMSPackageOrigin File();
};

// True when `a` and `b` name the same source (kind, and for feeds the
// address); signers are not compared.
bool PMSSameSource(const PMSPackageOrigin& a, const PMSPackageOrigin& b);

// The source in words: "the vendor's server", "the feed <address>", "a file".
std::string PMSSourceText(const PMSPackageOrigin& origin);

// The ORIGIN member's text, and its reading (see above). PMSParseOrigin of
// text that names no known origin gives a file whose signer is unknown.
std::string PMSOriginText(const PMSPackageOrigin& origin);
PMSPackageOrigin PMSParseOrigin(const std::string& text);

// The origin recorded in record folder `record`; a record without ORIGIN,
// or one that cannot be read, as the legacy reading above says.
PMSPackageOrigin PMSReadOrigin(const std::string& record);
// The origin of the installed package `id` (its published record); a file
// whose signer is unknown when it is not installed or has no ORIGIN.
PMSPackageOrigin PMSInstalledOrigin(const std::string& id);

// Whether the administrator lets an upgrade change the package's origin.
enum class PMSOriginChange { kRefuse, kAllow };

// What is known of a package file about to replace an installed version.
struct PMSIncoming {
  PMSPackageOrigin origin;  // its source, and the signer its signature verified
  bool by_keyring = false;  // the signature verified against the appliance keyring
};

// The rule every upgrade goes through, whoever starts it: the file must come
// from the installed package's own source, and be signed by the key that
// signed the installed version (for a package that was installed unsigned,
// or from an unknown signer, the file too is signed by no verified key) or
// by a key of the appliance keyring, which the administrator trusts for
// every source. A feed's keys thus vouch for that feed's packages only,
// never for replacing a package that came from elsewhere. With kAllow the
// administrator has switched the package to the file's origin, and the rule
// does not apply. Returns PKG_OK, or PKG_ERR_OTHER_ORIGIN with `*why` saying
// what differs, in words for the administrator.
int PMSJudgeUpgradeOrigin(const std::string& id, const PMSPackageOrigin& installed,
                          const PMSIncoming& incoming, PMSOriginChange change, std::string* why);

// What the administrator allowed one install beyond the usual rules.
struct PMSInstallChoices {
  PMSOriginChange change = PMSOriginChange::kRefuse;
  // True: when the volume has no room for the safety copy of the data that
  // an upgrade takes first (docs/package-tool.md), the upgrade goes on
  // without one instead of being refused. The administrator accepts that a
  // failed upgrade then cannot bring the data back.
  bool without_data_copy = false;
};

// A package file's source as the caller of an install knows it.
struct PMSInstallSource {
  // Where the file comes from; the signer is the package tool's to find.
  PMSPackageOrigin origin = PMSPackageOrigin::File();
  // The armored keys the feed publishes (kFeed only), which vouch for this
  // file alone.
  std::vector<std::string> feed_keys;
  PMSInstallChoices choices;
};
