// A catalogue rendered for "Server" "list" as far as that does not depend on
// the appliance's state, and kept beside the catalogue cache.
//
// Most of a listing is the same for every request until the catalogue
// changes: each entry with "id", "source", "blupgrade" false and its
// dependency lists in the structured form. Only the entries of installed
// packages or of packages with a download get more, from the appliance's
// state. So that work is done once per catalogue: the rendered entries are
// kept as JSON text in "/var/cache/kivo/pkgserver/listing/", one file per
// catalogue cache file and side, and a request copies the text of every
// entry that needs nothing of the appliance.
//
// A listing file names the digest of the catalogue text it was rendered
// from and a checksum of its own content; a file that does not match the
// catalogue in the cache, is damaged or of another format is not used: the
// listing is rendered again and the file replaced (atomically, so that a
// concurrent request reads either file whole). Failing to write it only
// costs the next request the rendering.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "pkgserver/mapped_file.h"
#include "pkgtool/package_origin.h"

namespace KIVOPackageServer {

enum class ListingSide { kVendor, kFeeds };

struct ListingEntry {
  std::string name;          // "package"
  bool has_version = false;  // whether the server's entry has "version" at all
  std::string version;       // its text; "" when it is not a string
  std::string icon;          // "icon" when a non-empty string, else ""
  size_t source = 0;         // its catalogue: an index into CatalogueListing::sources
  // The rendered entry: one JSON object written with KIVONewJsonWriter()
  // (klibc/json_text.h), as answers are written, so that it can stand in an
  // answer as it is. It views the listing's `files` and lives as long as the
  // listing.
  std::string_view text;
};

struct CatalogueListing {
  std::vector<ListingEntry> entries;  // catalogue order
  // The catalogues the entries come from: the vendor's, or each feed's.
  std::vector<PMSPackageOrigin> sources;
  // Vendor side: the distinct names of the server's "recommend" list, in
  // its order (a name counts at its first place).
  std::vector<std::string> recommend;
  // The listing files' text that the entries view (mapped, or rendered
  // when the file was not usable): a megabyte of entries is not copied.
  struct Text {
    MappedFile mapped;
    std::string rendered;
  };
  std::vector<std::unique_ptr<Text>> files;
};

// The vendor's catalogue (kVendor) or every feed's catalogue one after the
// other (kFeeds), cached or fetched as PMSQueryKivoPkgServer and
// PMSQueryOtherPkgServer do it, rendered into `*listing`. Entries that are
// not objects with a string "package" are left out. False, as those queries
// and their callers have it, when the vendor's answer is no catalogue (not
// an array, nor an object with "packages" and "recommend") or every feed
// failed; a feed whose answer is no catalogue is skipped. Every failure is
// logged.
bool PMSListCatalogue(ListingSide side, bool forceReload, const std::string& language,
                      CatalogueListing* listing);

}  // namespace KIVOPackageServer
