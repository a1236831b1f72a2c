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

#include "pkgtool/package_origin.h"

namespace KIVOPackageServer {

// The vendor's catalogue in `language` into `answer`. False when no server
// is configured or it gave no usable answer.
bool PMSQueryKivoPkgServer(bool forceReload, const char* language, Json::Value& answer);

// The catalogues of every feed merged into one array of entries (an answer
// object contributes its "packages"). True with an empty array when there
// are no feeds; false only when every feed failed.
bool PMSQueryOtherPkgServer(bool forceReload, const char* language, Json::Value& answer);

// The entries of the catalogue of the feed at `url` (an array), cached or
// fetched as above. False (logged) when the feed gave no usable answer or
// its answer is no catalogue.
bool PMSQueryFeedServer(const std::string& url, bool forceReload, const char* language,
                        Json::Value& entries);

// How long the feed probe may take in all, connecting included, whatever
// connect_timeout and catalogue_timeout say: a person waits on the page for
// it (docs/feeds.md).
inline constexpr long kFeedProbeSeconds = 10;

// One server's answer as text, for the feed probe. `forceReload` bypasses
// the cache; `extra` (an object of further query parameters) may be null or
// empty. A transfer takes at most `max_seconds` (positive) in all. False
// when the server gave no usable answer.
bool PMSQueryPkgServer(const char* language, std::string& answer, const std::string& feed,
                       bool forceReload, const Json::Value& extra, long max_seconds);

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

// How many entries a catalogue answer lists: its entries that are objects
// with a string "package" (the others are dropped wherever it is read); -1
// when the answer is no catalogue at all.
int64_t PMSListedEntryCount(const Json::Value& answer);

// Where a download of package `name` from `link` comes from: the source
// whose (cached or fetched) catalogue lists the package with exactly that
// link, whatever link the client named. `preferred` (the installed
// package's origin) is asked first, then the vendor's server, then the
// feeds in their order; a feed no longer listed is no source. A link that
// no catalogue lists is a file's (PMSPackageOrigin::File()). The signer is
// left empty: the package tool finds it.
PMSPackageOrigin PMSListingOrigin(const std::string& name, const std::string& link,
                                  const std::string& language, const PMSPackageOrigin& preferred);

// The entry of package `name` with the highest version in catalogue answer
// `answer` (an object with "packages", or an array of entries). False when
// it lists none.
bool PMSNewestEntry(const Json::Value& answer, const std::string& name, Json::Value& entry);

// The entry of package `name` from the vendor's (isKivo) or the feeds'
// cached-or-fetched catalogue; the highest version when several match. On
// the feeds' side, a package installed from a feed that is still listed and
// lists it gets the entry of that feed.
bool PMSFindServerEntry(const std::string& name, bool isKivo, const std::string& language,
                        Json::Value& entry);

}  // namespace KIVOPackageServer
