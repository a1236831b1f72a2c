// Images of server packages (icons, screenshots): fetched from the address a
// catalogue names and cached under the root as
// "/var/cache/kivo/pkgserver/images/<package>/<version>/<key>", where <key>
// is the SHA-256 of the address. The cache is keyed by the address itself
// (which names the server the image comes from), so a catalogue can never
// put its picture in the place of an image another catalogue names, even for
// the same package id and version.
//
// An image is fetched only when all of these hold, for the address and for
// every redirect:
// - it is an http or https address on the host and port of a catalogue the
//   appliance lists (the vendor's, vendor_url of pkgserver.conf, or an added
//   feed's);
// - every connection goes to a public address (checked after the name is
//   resolved), unless allow_private_image_addresses="yes" in pkgserver.conf
//   lets it go to loopback, link-local and private ones too;
// - the answer is 200 with a PNG, JPEG, GIF or WebP image, judged by its
//   bytes, not by what the server calls it. Anything else is not kept.
#pragma once

#include <string>

namespace KIVOPackageTool {

// The path of the image that `link` names for `package` at `version` in
// `*path`: from the cache, else fetched now (and cached). One process at a
// time fetches an image: when another one's fetch of it is in flight (the
// listing's background child), this waits for that fetch, at most a few
// seconds (docs/images.md), instead of asking the server again. False, with
// the reason logged for a refused or failed fetch, when `package` is no
// package id, `version` no version (each judged whole, a NUL included),
// `link` is empty, the image cannot be had under the rules above, or the
// fetch in flight outlasted the wait.
bool PMSServerImagePath(const std::string& package, const std::string& version,
                        const std::string& link, std::string* path);

// Queues the image that `link` names for `package` at `version` for a
// fetch in the background (one detached child per process fetches them in
// order under the rules above, skipping an image another process is
// fetching), unless it is cached or the names are not valid; the caller
// never waits for a server. Best effort: an image that
// cannot be queued is queued again by a later call.
void PMSQueueServerImage(const std::string& package, const std::string& version,
                         const std::string& link);

}  // namespace KIVOPackageTool
