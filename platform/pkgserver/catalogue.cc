#include "pkgserver/catalogue.h"

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <syslog.h>
#include <vector>

#include "klibc/atomic_file.h"
#include "klibc/hex.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/feed_file.h"
#include "pkgserver/server_config.h"
#include "pkgserver/server_net.h"
#include "pkgserver/source_status.h"
#include "pkgtool/version.h"

#define CATALOGUE_LOG(fmt, ...) syslog(LOG_ERR, "%s:%d " fmt, "catalogue", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageServer {

namespace {

std::string CacheDir() { return KIVORootPath("/var/cache/kivo/pkgserver"); }

// FNV-1a: a stable file name per server and language.
std::string CacheKey(const std::string& url, const std::string& language) {
  uint64_t h = 1469598103934665603ULL;
  for (unsigned char c : url + "\n" + language) h = (h ^ c) * 1099511628211ULL;
  char name[32];
  snprintf(name, sizeof(name), "%016llx", static_cast<unsigned long long>(h));
  return name;
}

// The server's address with what the appliance is appended.
std::string QueryUrl(const std::string& url, const std::string& language,
                     const Json::Value& extra) {
  // A missing device or settings file leaves its fields empty: the server
  // then answers for any device and the default channel.
  KeyValueMap device, info;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/device.conf"), &device)) device.clear();
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivoinfo.conf"), &info)) info.clear();
  std::string q = url + (url.find('?') == std::string::npos ? "?" : "&");
  q += "language=" + PMSUrlEncode(language) + "&arch=" + PMSUrlEncode(device["arch"]) +
       "&os_version=" + PMSUrlEncode(device["os_version"]) +
       "&channel=" + PMSUrlEncode(info["package_update_channel"]);
  if (extra.isObject()) {
    for (const std::string& key : extra.getMemberNames()) {
      if (extra[key].isString())
        q += "&" + PMSUrlEncode(key) + "=" + PMSUrlEncode(extra[key].asString());
    }
  }
  return q;
}

// The head of a cache file is read alone when the body may not be needed;
// a longer meta line is read with the whole file.
constexpr size_t kCacheHeadBytes = 8192;

struct CachedCatalogue {
  Json::Value meta;  // "url", "etag", "last_modified", "fetched", "digest"
  std::string body;
  bool body_read = false;
};

// The cache file's meta and, unless `head_only`, its body.
bool ReadCache(const std::string& path, bool head_only, CachedCatalogue* cached) {
  std::string text;
  if (!KIVOReadFile(path, &text, head_only ? kCacheHeadBytes : SIZE_MAX)) return false;
  size_t newline = text.find('\n');
  if (newline == std::string::npos) return head_only && ReadCache(path, false, cached);
  if (!KIVOParseJson(std::string_view(text).substr(0, newline), &cached->meta,
                     JsonSyntax::Lenient) ||
      !cached->meta.isObject()) {
    return false;
  }
  cached->body_read = !head_only;
  if (head_only) return true;
  // The body moves out of the file's text (erased in place, not copied): a
  // catalogue may be megabytes.
  text.erase(0, newline + 1);
  cached->body = std::move(text);
  return true;
}

std::string DigestText(uint64_t digest) {
  char hex[17];
  snprintf(hex, sizeof(hex), "%016llx", static_cast<unsigned long long>(digest));
  return hex;
}

// The digest the meta names, when it names a well-formed one.
bool MetaDigest(const Json::Value& meta, uint64_t* digest) {
  const Json::Value& text = meta["digest"];
  if (!text.isString() || text.asString().size() != 16 || !KIVOIsLowerHex(text.asString())) {
    return false;
  }
  *digest = strtoull(text.asCString(), nullptr, 16);
  return true;
}

// The cache only saves the next request a transfer: failing to write it is
// logged and otherwise harmless.
void WriteCache(const std::string& path, const CachedCatalogue& cached) {
  if (KIVOFSMkdirP(CacheDir().c_str()) != 0 ||
      !KIVOWriteFileAtomic(path, KIVOWriteJson(cached.meta) + "\n" + cached.body, SyncToDisk::No)) {
    syslog(LOG_WARNING, "%s:%d cannot write the catalogue cache %s", "catalogue", __LINE__,
           path.c_str());
  }
}

bool ParseAnswer(const std::string& body, Json::Value& answer) {
  Json::Value value;
  if (!KIVOParseJson(body, &value, JsonSyntax::Lenient)) return false;
  if (!value.isObject() && !value.isArray()) return false;
  answer = std::move(value);
  return true;
}

// A failed fetch of `url`, logged and on its source's record.
bool FetchFailed(const std::string& url, const std::string& reason, int line) {
  syslog(LOG_ERR, "%s:%d %s: %s", "catalogue", line, url.c_str(), reason.c_str());
  PMSRecordFetchFailure(url, reason, time(nullptr));
  return false;
}

// Asks the server within `limits`, conditionally when `cached` (read whole)
// is given, and leaves the answer in `*cached` and the cache file. The
// outcome goes on the source's record (source_status.h).
bool FetchFromServer(const std::string& url, const std::string& query, const std::string& language,
                     const HttpLimits& limits, const std::string& path, CachedCatalogue* cached,
                     bool have) {
  HttpFetch fetch;
  fetch.url = query;
  if (have) {
    fetch.if_none_match = cached->meta["etag"].asString();
    fetch.if_modified_since = cached->meta["last_modified"].asString();
  }
  if (!PMSServerFetch(limits, fetch)) return FetchFailed(url, fetch.error, __LINE__);
  if (have && fetch.status == 304) {
    cached->meta["fetched"] = static_cast<Json::Int64>(time(nullptr));
    // A cache written before the meta named its digest gets it now.
    uint64_t digest;
    if (!MetaDigest(cached->meta, &digest))
      cached->meta["digest"] = DigestText(PMSCatalogueDigest(cached->body));
    WriteCache(path, *cached);
    // Unchanged: the count of its last whole answer still holds.
    PMSRecordFetchSuccess(url, -1, cached->meta["fetched"].asInt64());
    return true;
  }
  Json::Value parsed;
  if (fetch.status != 200) {
    return FetchFailed(url, "the server answered HTTP " + std::to_string(fetch.status), __LINE__);
  }
  if (!ParseAnswer(fetch.body, parsed)) {
    return FetchFailed(url, "the answer is not a JSON catalogue", __LINE__);
  }
  cached->meta = Json::Value(Json::objectValue);
  cached->meta["url"] = url;
  cached->meta["language"] = language;
  cached->meta["etag"] = fetch.etag;
  cached->meta["last_modified"] = fetch.last_modified;
  cached->meta["fetched"] = static_cast<Json::Int64>(time(nullptr));
  cached->meta["digest"] = DigestText(PMSCatalogueDigest(fetch.body));
  cached->body = std::move(fetch.body);
  WriteCache(path, *cached);
  // JSON that lists no entries at all is cached as before (its readers
  // judge it), but its source is failing: it serves no catalogue.
  const int64_t listed = PMSListedEntryCount(parsed);
  if (listed < 0) {
    (void)FetchFailed(url, "the answer is neither an array nor an object with \"packages\"",
                      __LINE__);
  } else {
    PMSRecordFetchSuccess(url, listed, cached->meta["fetched"].asInt64());
  }
  return true;
}

// The server's answer from the cache or the server into `*out`; with
// kIfNeeded the body of a fresh cache whose meta names its digest is not
// read. A positive `max_seconds` holds the transfer to that many seconds in
// all; 0 leaves it to the root's catalogue timeouts.
bool FetchText(const std::string& url, const std::string& language, bool force,
               const Json::Value& extra, CatalogueBody want, long max_seconds, CatalogueText* out) {
  if (!PMSIsServerUrl(url)) {
    CATALOGUE_LOG("%s: not an http or https address", url.c_str());
    return false;
  }
  PkgServerConfig config = PMSLoadServerConfig();
  const std::string query = QueryUrl(url, language, extra);
  out->cache_name = CacheKey(query, language);
  const std::string path = CacheDir() + "/" + out->cache_name;
  CachedCatalogue cached;
  bool have = !force && ReadCache(path, want == CatalogueBody::kIfNeeded, &cached);
  long age = have ? static_cast<long>(time(nullptr)) - cached.meta["fetched"].asInt64() : 0;
  const bool fresh = have && age >= 0 && age < config.catalogue_max_age_s;
  if (fresh && !cached.body_read && MetaDigest(cached.meta, &out->digest)) {
    out->body.clear();
    out->has_body = false;
    return true;
  }
  if (have && !cached.body_read) have = ReadCache(path, false, &cached);
  const HttpLimits limits =
      max_seconds > 0 ? config.CatalogueLimitsWithin(max_seconds) : config.CatalogueLimits();
  if (!(fresh && have) && !FetchFromServer(url, query, language, limits, path, &cached, have)) {
    return false;
  }
  if (!MetaDigest(cached.meta, &out->digest)) out->digest = PMSCatalogueDigest(cached.body);
  out->body = std::move(cached.body);
  out->has_body = true;
  return true;
}

bool FetchText(const std::string& url, const std::string& language, bool force,
               const Json::Value& extra, long max_seconds, std::string& body) {
  CatalogueText text;
  if (!FetchText(url, language, force, extra, CatalogueBody::kAlways, max_seconds, &text)) {
    return false;
  }
  body = std::move(text.body);
  return true;
}

bool QueryServer(const std::string& url, bool force, const std::string& language,
                 Json::Value& answer) {
  std::string body;
  if (!FetchText(url, language, force, Json::Value(), 0, body)) return false;
  if (ParseAnswer(body, answer)) return true;
  CATALOGUE_LOG("%s: the cached answer is not a JSON catalogue", url.c_str());
  return false;
}

std::string Text(const Json::Value& v) { return v.isString() ? v.asString() : ""; }

}  // namespace

std::vector<std::string> PMSFeedUrls() {
  std::vector<std::string> urls;
  for (const ListedFeed& feed : PMSListedFeeds()) urls.push_back(feed.url);
  return urls;
}

std::string PMSVendorCatalogueUrl() {
  PkgServerConfig config = PMSLoadServerConfig();
  if (config.vendor_url.empty()) {
    CATALOGUE_LOG("no vendor_url in %s", PMSServerConfigPath().c_str());
  }
  return config.vendor_url;
}

bool PMSCatalogueText(const std::string& url, bool forceReload, const std::string& language,
                      CatalogueBody want, CatalogueText* text) {
  return FetchText(url, language, forceReload, Json::Value(), want, 0, text);
}

uint64_t PMSCatalogueDigest(std::string_view text) {
  constexpr uint64_t kPrime = 1099511628211ULL;
  uint64_t h = 1469598103934665603ULL ^ text.size();
  size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) {
    uint64_t word;
    memcpy(&word, text.data() + i, sizeof(word));
    h = (h ^ word) * kPrime;
    h ^= h >> 32;
  }
  for (; i < text.size(); ++i) h = (h ^ static_cast<unsigned char>(text[i])) * kPrime;
  return h;
}

const Json::Value* PMSCatalogueEntries(const Json::Value& answer) {
  if (answer.isArray()) return &answer;
  if (answer.isObject() && answer["packages"].isArray()) return &answer["packages"];
  return nullptr;
}

int64_t PMSListedEntryCount(const Json::Value& answer) {
  const Json::Value* entries = PMSCatalogueEntries(answer);
  if (!entries) return -1;
  int64_t listed = 0;
  for (const Json::Value& e : *entries) listed += e.isObject() && e["package"].isString();
  return listed;
}

bool PMSQueryKivoPkgServer(bool forceReload, const char* language, Json::Value& answer) {
  const std::string url = PMSVendorCatalogueUrl();
  return !url.empty() && QueryServer(url, forceReload, language ? language : "", answer);
}

bool PMSQueryFeedServer(const std::string& url, bool forceReload, const char* language,
                        Json::Value& entries) {
  Json::Value one;
  if (!QueryServer(url, forceReload, language ? language : "", one)) return false;
  if (!PMSCatalogueEntries(one)) {
    CATALOGUE_LOG("%s: neither an array nor an object with \"packages\"", url.c_str());
    return false;
  }
  entries = one.isArray() ? std::move(one) : std::move(one["packages"]);
  return true;
}

bool PMSQueryOtherPkgServer(bool forceReload, const char* language, Json::Value& answer) {
  answer = Json::Value(Json::arrayValue);
  std::vector<std::string> urls = PMSFeedUrls();
  bool any = urls.empty();
  for (const std::string& url : urls) {
    Json::Value entries;
    if (!PMSQueryFeedServer(url, forceReload, language, entries)) continue;
    any = true;
    for (const Json::Value& entry : entries) answer.append(entry);
  }
  return any;
}

bool PMSQueryPkgServer(const char* language, std::string& answer, const std::string& feed,
                       bool forceReload, const Json::Value& extra, long max_seconds) {
  return FetchText(feed, language ? language : "", forceReload, extra, max_seconds, answer);
}

namespace {

// True when the catalogue at `url` lists package `name` with exactly `link`.
bool Lists(const std::string& url, const std::string& name, const std::string& link,
           const std::string& language) {
  Json::Value answer;
  if (url.empty() || !QueryServer(url, false, language, answer)) return false;
  const Json::Value* entries = PMSCatalogueEntries(answer);
  if (!entries) return false;
  for (const Json::Value& e : *entries) {
    if (e.isObject() && Text(e["package"]) == name && Text(e["link"]) == link) return true;
  }
  return false;
}

}  // namespace

PMSPackageOrigin PMSListingOrigin(const std::string& name, const std::string& link,
                                  const std::string& language, const PMSPackageOrigin& preferred) {
  if (link.empty()) return PMSPackageOrigin::File();
  std::vector<PMSPackageOrigin> sources;
  const std::vector<std::string> feeds = PMSFeedUrls();
  // A feed that is no longer listed is no source any more.
  const bool preferred_listed =
      preferred.kind == PMSOriginKind::kVendor ||
      (preferred.kind == PMSOriginKind::kFeed &&
       std::find(feeds.begin(), feeds.end(), preferred.feed) != feeds.end());
  if (preferred_listed) sources.push_back(preferred);
  sources.push_back(PMSPackageOrigin::Vendor());
  for (const std::string& url : feeds) sources.push_back(PMSPackageOrigin::Feed(url));
  const std::string vendor_url = PMSLoadServerConfig().vendor_url;
  for (const PMSPackageOrigin& source : sources) {
    const bool vendor = source.kind == PMSOriginKind::kVendor;
    if (Lists(vendor ? vendor_url : source.feed, name, link, language)) {
      PMSPackageOrigin found = source;
      found.signer.clear();
      return found;
    }
  }
  return PMSPackageOrigin::File();
}

bool PMSNewestEntry(const Json::Value& answer, const std::string& name, Json::Value& entry) {
  const Json::Value* entries = PMSCatalogueEntries(answer);
  if (!entries) return false;
  bool found = false;
  for (const Json::Value& e : *entries) {
    if (!e.isObject() || !e["package"].isString() || e["package"].asString() != name) continue;
    if (found && PMSCompareVersion(Text(e["version"]), Text(entry["version"])) <= 0) continue;
    entry = e;
    found = true;
  }
  return found;
}

namespace {

// The entry of `name` in the feed an installed package came from, when that
// feed is still listed and lists it: its upgrades come from there, not from
// whichever feed offers the highest version.
bool EntryOfOwnFeed(const std::string& name, const std::string& language, Json::Value& entry) {
  const PMSPackageOrigin origin = PMSInstalledOrigin(name);
  if (origin.kind != PMSOriginKind::kFeed) return false;
  const std::vector<std::string> feeds = PMSFeedUrls();
  if (std::find(feeds.begin(), feeds.end(), origin.feed) == feeds.end()) return false;
  Json::Value answer;
  return QueryServer(origin.feed, false, language, answer) && PMSNewestEntry(answer, name, entry);
}

}  // namespace

bool PMSFindServerEntry(const std::string& name, bool isKivo, const std::string& language,
                        Json::Value& entry) {
  if (!isKivo && EntryOfOwnFeed(name, language, entry)) return true;
  Json::Value answer;
  bool ok = isKivo ? PMSQueryKivoPkgServer(false, language.c_str(), answer)
                   : PMSQueryOtherPkgServer(false, language.c_str(), answer);
  return ok && PMSNewestEntry(answer, name, entry);
}

}  // namespace KIVOPackageServer
