// Catalogues of package servers: the vendor's server (vendor_url of
// pkgserver.conf) and the feeds of "/usr/kivo/etc/packages/feeds". The format
// is docs/package-server.md's.
//
// A catalogue is asked for with a GET of the server's address plus the query
// parameters language, arch, os_version and channel (a static file ignores
// them). Answers are cached under the root per server and language
// ("/var/cache/kivo/pkgserver"); a cached copy younger than
// catalogue_max_age is used as it is, an older one is revalidated with
// If-None-Match / If-Modified-Since (a 304 keeps it). A forced reload asks
// without conditions. Only answers that parse as a JSON object or array are
// cached or returned. Every failure is logged with the server and the reason.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <json/value.h>

namespace KIVOPackageServer {

// The vendor's catalogue in `language` into `answer`. False when no server
// is configured or it gave no usable answer.
bool PMSQueryKivoPkgServer(bool forceReload, const char* language, Json::Value& answer);

// The catalogues of every feed merged into one array of entries (an answer
// object contributes its "packages"). True with an empty array when there
// are no feeds; false only when every feed failed.
bool PMSQueryOtherPkgServer(bool forceReload, const char* language, Json::Value& answer);

// One server's answer as text, for the feed probe. `forceReload` bypasses
// the cache; `extra` (an object of further query parameters) may be null or
// empty. False when the server gave no usable answer.
bool PMSQueryPkgServer(const char* language, std::string& answer, const std::string& feed,
                       bool forceReload, const Json::Value& extra);

// The vendor's catalogue address; "" (logged) when none is configured.
std::string PMSVendorCatalogueUrl();

// The feeds' catalogue addresses, in the order of the feed file.
std::vector<std::string> PMSFeedUrls();

// A 64-bit digest of catalogue text: which catalogue a file derived from
// one was made from. FNV-1a over 8-byte words with the high half folded back
// at each step: a few instructions per word, for it runs over megabytes at
// every request, and any one changed word changes it.
uint64_t PMSCatalogueDigest(std::string_view text);

struct CatalogueText {
  std::string cache_name;  // the cache file's name: derived files are named after it
  uint64_t digest = 0;     // PMSCatalogueDigest of the text
  bool has_body = false;
  std::string body;  // the text, when has_body
};
enum class CatalogueBody { kAlways, kIfNeeded };

// One server's catalogue, cached or fetched as the queries above do it.
// With kIfNeeded the text of a fresh cached copy is not read (the cache
// names its digest): a caller that has what it derived from that digest
// needs no more; otherwise it asks again with kAlways. False (logged) when
// the server gave no usable answer.
bool PMSCatalogueText(const std::string& url, bool forceReload, const std::string& language,
                      CatalogueBody want, CatalogueText* text);

// The entries of a catalogue answer: its "packages" (object form) or the
// answer itself (array form); null for anything else.
const Json::Value* PMSCatalogueEntries(const Json::Value& answer);

// The address of the feed whose (cached or fetched) catalogue lists package
// `name` with exactly `link`; "" when no listed feed does. A download from
// that link is a download from that feed, whatever the client said.
std::string PMSFeedListing(const std::string& name, const std::string& link,
                           const std::string& language);

// The entry of package `name` from the vendor's (isKivo) or the feeds'
// cached-or-fetched catalogue; the highest version when several match.
bool PMSFindServerEntry(const std::string& name, bool isKivo, const std::string& language,
                        Json::Value& entry);

}  // namespace KIVOPackageServer
