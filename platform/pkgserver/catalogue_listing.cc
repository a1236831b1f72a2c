#include "pkgserver/catalogue_listing.h"

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <set>
#include <sstream>
#include <syslog.h>

#include <json/value.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/sysroot.h"
#include "pkgserver/catalogue.h"
#include "pkgtool/dependency.h"

#define LISTING_LOG(fmt, ...) \
  syslog(LOG_ERR, "%s:%d " fmt, "catalogue_listing", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageServer {

namespace {

// The rendering's version. Raise it whenever what RenderEntry writes or the
// file's layout changes: files of another version are rendered again.
constexpr int kListingFormat = 2;
constexpr char kMagic[] = "kivo-listing";
// A listing is about as large as its catalogue (at most catalogue_max_bytes,
// 16 MiB by default); a larger file is no listing of ours.
constexpr size_t kMaxListingBytes = 64 << 20;

std::string ListingDir() { return KIVORootPath("/var/cache/kivo/pkgserver/listing"); }

const char* SideName(ListingSide side) { return side == ListingSide::kVendor ? "kivo" : "others"; }

std::string Text(const Json::Value& v) { return v.isString() ? v.asString() : ""; }

// A dependency list of an entry in the structured form: "conf_<key>" (JSON)
// wins over "<key>" (text); both are replaced by "<out>".
void RewriteDependencies(Json::Value& entry, const char* conf_key, const char* text_key,
                         const char* out_key) {
  DepPkgVector deps;
  if (entry.isMember(conf_key) && !entry[conf_key].empty()) {
    PMSParseDepJSON(entry[conf_key], deps);
    entry.removeMember(conf_key);
  } else if (entry[text_key].isString() && !entry[text_key].asString().empty()) {
    PMSExplodeDepPKGString(entry[text_key].asString(), deps);
    entry.removeMember(text_key);
  }
  Json::Value out;
  deps.toJSON(out);
  entry[out_key] = std::move(out);
}

void PutField(std::string* out, const std::string& field) {
  *out += std::to_string(field.size());
  *out += ':';
  *out += field;
  *out += ',';
}

// Renders catalogue element `element` (consumed) of the catalogue at `url`
// into the fields of a listing file (see Render): everything of a listed
// entry that does not depend on the appliance. An entry of a feed names the
// feed in "feed", so that the page shows it beside that feed's state. False
// for an element that is not listed.
bool RenderEntry(Json::Value& element, ListingSide side, const std::string& url,
                 Json::StreamWriter& writer, std::string* fields) {
  if (!element.isObject() || !element["package"].isString()) return false;
  const std::string name = element["package"].asString();
  PutField(fields, name);
  PutField(fields, element.isMember("version") ? "=" + Text(element["version"]) : "");
  element["id"] = name;
  element["blupgrade"] = false;
  element["source"] = SideName(side);
  if (side == ListingSide::kFeeds) element["feed"] = url;
  RewriteDependencies(element, "conf_deppkgs", "deppkgs", "deppkgs");
  RewriteDependencies(element, "conf_conxpkgs", "conflictpkgs", "conflictpkgs");
  // Listed entries have always carried "icon" (null when the server gave
  // none), and "version" (null) beside an icon: clients may test for them.
  Json::Value& icon = element["icon"];
  const bool has_icon = icon.isString() && !icon.asString().empty();
  PutField(fields, has_icon ? icon.asString() : "");
  if (has_icon) element["version"];
  std::ostringstream text;
  writer.write(element, &text);
  PutField(fields, text.str());
  return true;
}

// The catalogue's list of elements (and the vendor's recommendations), by
// the rules of its side; null when the answer is no catalogue there.
Json::Value* CatalogueList(Json::Value& answer, ListingSide side,
                           std::vector<std::string>* recommend) {
  if (side == ListingSide::kFeeds) {
    return answer.isObject() && answer["packages"].isArray() ? &answer["packages"]
           : answer.isArray()                                ? &answer
                                                             : nullptr;
  }
  if (!answer.isObject() || answer.empty()) return answer.isArray() ? &answer : nullptr;
  if (!answer.isMember("packages") || !answer.isMember("recommend") ||
      !answer["packages"].isArray()) {
    return nullptr;
  }
  const Json::Value& names = answer["recommend"];
  std::set<std::string> seen;
  for (Json::ArrayIndex i = 0; names.isArray() && i < names.size(); ++i) {
    if (names[i].isString() && seen.insert(names[i].asString()).second) {
      recommend->push_back(names[i].asString());
    }
  }
  return &answer["packages"];
}

// The file: one header line
//   kivo-listing FORMAT SIDE CATALOGUE-DIGEST CHECKSUM ENTRIES RECOMMENDATIONS
// (digests in hex), then netstrings ("<length>:<bytes>,"): the recommended
// names, then per entry its name, "=" + version (or "" without one), icon
// and text. The checksum covers everything after the header line.

std::string Header(ListingSide side, uint64_t catalogue, uint64_t checksum, size_t entries,
                   size_t recommend) {
  char line[160];
  snprintf(line, sizeof(line), "%s %d %s %016llx %016llx %zu %zu\n", kMagic, kListingFormat,
           SideName(side), static_cast<unsigned long long>(catalogue),
           static_cast<unsigned long long>(checksum), entries, recommend);
  return line;
}

// Renders catalogue text `body` (with digest `catalogue`) into the text of
// a listing file; false (logged) when it is no catalogue for `side`.
bool Render(const std::string& body, uint64_t catalogue, ListingSide side, const std::string& url,
            std::string* file) {
  Json::Value answer;
  if (!KIVOParseJson(body, &answer, JsonSyntax::Lenient)) {
    LISTING_LOG("%s: the cached answer is not a JSON catalogue", url.c_str());
    return false;
  }
  std::vector<std::string> recommend;
  Json::Value* list =
      answer.isObject() || answer.isArray() ? CatalogueList(answer, side, &recommend) : nullptr;
  if (!list) {
    LISTING_LOG("%s: neither an array nor an object with \"packages\"%s", url.c_str(),
                side == ListingSide::kVendor ? " and \"recommend\"" : "");
    return false;
  }
  std::string fields;
  for (const std::string& name : recommend) PutField(&fields, name);
  const std::unique_ptr<Json::StreamWriter> writer = KIVONewJsonWriter();
  size_t entries = 0;
  for (Json::Value& element : *list) entries += RenderEntry(element, side, url, *writer, &fields);
  *file = Header(side, catalogue, PMSCatalogueDigest(fields), entries, recommend.size()) + fields;
  return true;
}

// Reads netstrings from a file's text; every length is checked against
// what is left.
class FieldReader {
 public:
  FieldReader(const char* begin, const char* end) : p_(begin), end_(end) {}
  bool Next(std::string* field) {
    std::string_view view;
    if (!Next(&view)) return false;
    field->assign(view.data(), view.size());
    return true;
  }
  bool Next(std::string_view* field) {
    size_t length = 0;
    const char* digits = p_;
    while (p_ < end_ && *p_ >= '0' && *p_ <= '9' && p_ - digits < 10)
      length = length * 10 + (*p_++ - '0');
    if (p_ == digits || p_ >= end_ || *p_ != ':' || static_cast<size_t>(end_ - p_) < length + 2)
      return false;
    *field = std::string_view(p_ + 1, length);
    p_ += length + 1;
    return *p_++ == ',';
  }
  bool AtEnd() const { return p_ == end_; }

 private:
  const char* p_;
  const char* end_;
};

bool ReadEntry(FieldReader& fields, ListingEntry* e) {
  std::string_view version;
  if (!fields.Next(&e->name) || !fields.Next(&version) || !fields.Next(&e->icon) ||
      !fields.Next(&e->text)) {
    return false;
  }
  e->has_version = !version.empty();
  if (e->has_version && version[0] != '=') return false;
  if (e->has_version) e->version.assign(version.data() + 1, version.size() - 1);
  return !e->text.empty();
}

// The listing of file text `file` when it is whole and was rendered from the
// catalogue with digest `catalogue` for `side`.
bool Parse(std::string_view file, ListingSide side, uint64_t catalogue, CatalogueListing* listing) {
  size_t newline = file.find('\n');
  if (newline == std::string::npos || newline > 160) return false;
  const std::string header(file.substr(0, newline));
  char magic[16], side_name[16];
  int format = 0, used = 0;
  unsigned long long digest = 0, checksum = 0;
  size_t entries = 0, recommend = 0;
  if (sscanf(header.c_str(), "%15s %d %15s %16llx %16llx %zu %zu%n", magic, &format, side_name,
             &digest, &checksum, &entries, &recommend, &used) != 7 ||
      static_cast<size_t>(used) != newline || std::string(magic) != kMagic ||
      format != kListingFormat || std::string(side_name) != SideName(side) || digest != catalogue) {
    return false;
  }
  const char* begin = file.data() + newline + 1;
  const char* end = file.data() + file.size();
  // Every entry takes four fields of at least three bytes ("0:,"), every
  // name one: larger counts are no listing of ours.
  if (PMSCatalogueDigest(std::string_view(begin, end - begin)) != checksum ||
      entries > file.size() / 12 || recommend > file.size() / 3) {
    return false;
  }
  FieldReader fields(begin, end);
  listing->recommend.resize(recommend);
  for (std::string& name : listing->recommend) {
    if (!fields.Next(&name)) return false;
  }
  listing->entries.resize(entries);
  for (ListingEntry& e : listing->entries) {
    if (!ReadEntry(fields, &e)) return false;
  }
  return fields.AtEnd();
}

// The listing of catalogue `cat` from its file, when that is current and
// whole.
bool ReadListing(const std::string& path, const CatalogueText& cat, ListingSide side,
                 CatalogueListing::Text* file, CatalogueListing* one) {
  return file->mapped.Open(path, kMaxListingBytes) &&
         Parse(file->mapped.text(), side, cat.digest, one);
}

// Renders catalogue `cat` (its text read now if need be) and replaces the
// listing file.
bool RenderListing(const std::string& url, const std::string& language, const std::string& path,
                   CatalogueText* cat, ListingSide side, CatalogueListing::Text* file,
                   CatalogueListing* one) {
  if (!cat->has_body && !PMSCatalogueText(url, false, language, CatalogueBody::kAlways, cat)) {
    return false;
  }
  if (!Render(cat->body, cat->digest, side, url, &file->rendered)) return false;
  if (KIVOFSMkdirP(ListingDir().c_str()) != 0 ||
      !KIVOWriteFileAtomic(path, file->rendered, SyncToDisk::No)) {
    syslog(LOG_WARNING, "%s:%d cannot write the catalogue listing %s", "catalogue_listing",
           __LINE__, path.c_str());
  }
  if (Parse(file->rendered, side, cat->digest, one)) return true;
  LISTING_LOG("%s: the rendered listing does not read back", url.c_str());
  return false;
}

// One catalogue's listing added to `*listing`, its entries marked as coming
// from `source`: from its file when that is current and whole, else rendered
// and the file replaced.
bool ListOne(const std::string& url, const PMSPackageOrigin& source, bool force,
             const std::string& language, ListingSide side, CatalogueListing* listing) {
  CatalogueText cat;
  if (!PMSCatalogueText(url, force, language, CatalogueBody::kIfNeeded, &cat)) return false;
  const std::string path = ListingDir() + "/" + cat.cache_name + "." + SideName(side);
  auto file = std::make_unique<CatalogueListing::Text>();
  CatalogueListing one;
  if (!ReadListing(path, cat, side, file.get(), &one)) {
    one = CatalogueListing();
    if (!RenderListing(url, language, path, &cat, side, file.get(), &one)) return false;
  }
  listing->files.push_back(std::move(file));
  listing->sources.push_back(source);
  for (ListingEntry& e : one.entries) {
    e.source = listing->sources.size() - 1;
    listing->entries.push_back(std::move(e));
  }
  if (listing->recommend.empty()) listing->recommend = std::move(one.recommend);
  return true;
}

}  // namespace

bool PMSListCatalogue(ListingSide side, bool forceReload, const std::string& language,
                      CatalogueListing* listing) {
  *listing = CatalogueListing();
  if (side == ListingSide::kVendor) {
    const std::string url = PMSVendorCatalogueUrl();
    return !url.empty() &&
           ListOne(url, PMSPackageOrigin::Vendor(), forceReload, language, side, listing);
  }
  // Feeds have no recommendations: their listings are rendered without.
  const std::vector<std::string> urls = PMSFeedUrls();
  bool any = urls.empty();
  for (const std::string& url : urls)
    any = ListOne(url, PMSPackageOrigin::Feed(url), forceReload, language, side, listing) || any;
  return any;
}

}  // namespace KIVOPackageServer
