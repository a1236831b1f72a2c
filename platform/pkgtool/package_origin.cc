#include "pkgtool/package_origin.h"

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"

namespace {

constexpr char kVendorName[] = "vendor";
constexpr char kFeedName[] = "feed";
constexpr char kFileName[] = "file";
// ORIGIN is a few short lines; anything longer is no record of ours.
constexpr size_t kMaxOriginBytes = 8192;

// A file whose signer is unknown: the reading of a record without ORIGIN.
PMSPackageOrigin Unrecorded() {
  PMSPackageOrigin origin = PMSPackageOrigin::File();
  origin.recorded = false;
  return origin;
}

std::string SignerText(const PMSPackageOrigin& origin) {
  if (!origin.recorded) return "a key nobody recorded";
  return origin.signer.empty() ? "no verified key" : "key " + origin.signer;
}

}  // namespace

PMSPackageOrigin PMSPackageOrigin::Vendor() {
  PMSPackageOrigin origin;
  origin.kind = PMSOriginKind::kVendor;
  return origin;
}

PMSPackageOrigin PMSPackageOrigin::Feed(const std::string& address) {
  PMSPackageOrigin origin;
  origin.kind = PMSOriginKind::kFeed;
  origin.feed = address;
  return origin;
}

PMSPackageOrigin PMSPackageOrigin::File() { return PMSPackageOrigin(); }

bool PMSSameSource(const PMSPackageOrigin& a, const PMSPackageOrigin& b) {
  return a.kind == b.kind && (a.kind != PMSOriginKind::kFeed || a.feed == b.feed);
}

std::string PMSSourceText(const PMSPackageOrigin& origin) {
  switch (origin.kind) {
    case PMSOriginKind::kVendor:
      return "the vendor's server";
    case PMSOriginKind::kFeed:
      return "the feed " + origin.feed;
    case PMSOriginKind::kFile:
      break;
  }
  return "a file";
}

std::string PMSOriginText(const PMSPackageOrigin& origin) {
  const char* kind = origin.kind == PMSOriginKind::kVendor ? kVendorName
                     : origin.kind == PMSOriginKind::kFeed ? kFeedName
                                                           : kFileName;
  std::string text = KIVOKeyValueLine("origin", kind) + "\n";
  if (origin.kind == PMSOriginKind::kFeed) text += KIVOKeyValueLine("feed", origin.feed) + "\n";
  return text + KIVOKeyValueLine("signer", origin.signer) + "\n";
}

PMSPackageOrigin PMSParseOrigin(const std::string& text) {
  KeyValueMap kv = KIVOKeyValueParse(text);
  PMSPackageOrigin origin;
  if (kv["origin"] == kVendorName) {
    origin = PMSPackageOrigin::Vendor();
  } else if (kv["origin"] == kFeedName && !kv["feed"].empty()) {
    origin = PMSPackageOrigin::Feed(kv["feed"]);
  } else if (kv["origin"] == kFileName) {
    origin = PMSPackageOrigin::File();
  } else {
    return Unrecorded();
  }
  // Without its signer line the record says nothing of the signer.
  if (kv.count("signer") == 0) return Unrecorded();
  origin.signer = kv["signer"];
  return origin;
}

PMSPackageOrigin PMSReadOrigin(const std::string& record) {
  std::string text;
  if (!KIVOReadFile(record + "/ORIGIN", &text, kMaxOriginBytes)) return Unrecorded();
  return PMSParseOrigin(text);
}

PMSPackageOrigin PMSInstalledOrigin(const std::string& id) {
  if (!PackageRegistry::IsInstalled(id)) return Unrecorded();
  return PMSReadOrigin(PackageRegistry::RecordDir(id));
}

int PMSJudgeUpgradeOrigin(const std::string& id, const PMSPackageOrigin& installed,
                          const PMSIncoming& incoming, PMSOriginChange change, std::string* why) {
  if (change == PMSOriginChange::kAllow) return PKG_OK;
  const std::string switch_words =
      "; only an administrator who switches the package's origin can install it from there";
  if (!PMSSameSource(installed, incoming.origin)) {
    *why = id + " was installed from " + PMSSourceText(installed) +
           ", and this version comes from " + PMSSourceText(incoming.origin) + switch_words;
    return PKG_ERR_OTHER_ORIGIN;
  }
  // A key of the appliance keyring is trusted for every source.
  if (incoming.by_keyring) return PKG_OK;
  if (installed.recorded && installed.signer == incoming.origin.signer) return PKG_OK;
  *why = id + " was signed by " + SignerText(installed) + ", and this version by " +
         SignerText(incoming.origin) + switch_words;
  return PKG_ERR_OTHER_ORIGIN;
}
