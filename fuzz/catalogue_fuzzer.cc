// Fuzzes what a package server or feed sends as its catalogue: the JSON
// reader in both syntaxes, the catalogue's entries and the newest entry of a
// package, and the judge of the armored keys a feed publishes in
// "keyrings", each element also judged on its own. A catalogue nested
// deeper than any reader allows, or a secret key under a public armor, must
// come back as a refusal, never as a crash.
//
// Contracts checked: the reader never throws and leaves null on failure;
// strict text is lenient text too; an entry found is an object of that
// package; a block judged a public key holds no secret packet.
#include <cstddef>
#include <cstdint>
#include <string>

#include <json/value.h>

#include "fuzz_support.h"
#include "klibc/json_text.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/feed_keys.h"
#include "pkgserver/openpgp_key_block.h"

namespace {

void CheckKeys(const Json::Value& keyrings) {
  if (!keyrings.isArray()) return;
  for (const Json::Value& key : keyrings) {
    if (!key.isString()) continue;
    const std::string text = key.asString();
    const bool public_block = KIVOPackageServer::PMSIsArmoredPublicKey(text);
    const auto content = KIVOPackageServer::PMSKeyBlockContent(text);
    FuzzRequire(!public_block || content == KIVOPackageServer::KeyBlockContent::kPublicKey,
                "a block with other packets passed as a public key");
  }
}

void CheckEntries(const Json::Value& answer) {
  const Json::Value* entries = KIVOPackageServer::PMSCatalogueEntries(answer);
  if (!entries || !entries->isArray()) return;
  for (const Json::Value& e : *entries) {
    if (!e.isObject() || !e["package"].isString()) continue;
    Json::Value newest;
    if (KIVOPackageServer::PMSNewestEntry(answer, e["package"].asString(), newest)) {
      FuzzRequire(newest.isObject() && newest["package"] == e["package"],
                  "the newest entry is not one of the package");
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  Json::Value strict, lenient;
  const bool strict_ok = KIVOParseJson(text, &strict);
  const bool lenient_ok = KIVOParseJson(text, &lenient, JsonSyntax::Lenient);
  FuzzRequire(strict_ok || strict.isNull(), "a failed strict read left a value");
  FuzzRequire(lenient_ok || lenient.isNull(), "a failed lenient read left a value");
  FuzzRequire(!strict_ok || lenient_ok, "strict text was refused as lenient text");
  if (!lenient_ok) {
    // The input as one armored key, as a feed may list it.
    Json::Value one(Json::arrayValue);
    one.append(text);
    CheckKeys(one);
    return 0;
  }
  CheckEntries(lenient);
  if (lenient.isObject()) CheckKeys(lenient["keyrings"]);
  return 0;
}
