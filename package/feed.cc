// Feeds (package servers the user adds beside the vendor's) and the
// appliance's code-signing keyring.

#include <chrono>
#include <limits.h>
#include <memory>
#include <unistd.h>
#include <vector>

#include "error_codes.h"
#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/feed_file.h"
#include "pkgserver/feed_keys.h"
#include "pkgserver/source_status.h"
#include "request_values.h"
#include "settings/web_utils.h"

#include <stdlib.h>

namespace KIVO_PACKAGE {

namespace {

using KIVOPackageServer::PMSFeedFilePath;

// A feed's answer and a request's "list" are strict JSON with an object or
// an array at the root.
bool ParseDocument(const std::string& text, Json::Value* out) {
  return KIVOParseJson(text, out) && (out->isObject() || out->isArray());
}

// A missing or empty feed file is an empty list; anything else must load as
// a JSON array.
bool LoadFeeds(Json::Value* feeds, bool missing_is_empty) {
  const std::string path = PMSFeedFilePath();
  std::string text;
  if (missing_is_empty &&
      (!KLIBCFileExist(path.c_str()) || (KIVOReadFile(path, &text) && text.empty()))) {
    *feeds = Json::Value(Json::arrayValue);
    return true;
  }
  if (!WebUtils::LoadJsonFile(path, *feeds) || !feeds->isArray()) {
    PKG_LOG_ERR("Fail to load %s, %m", path.c_str());
    return false;
  }
  return true;
}

bool SaveFeeds(const Json::Value& feeds) {
  if (WebUtils::SaveJsonFile(PMSFeedFilePath(), feeds)) return true;
  PKG_LOG_ERR("Fail to save %s, %m", PMSFeedFilePath().c_str());
  return false;
}

std::string Address(const Json::Value& object, const char* key) {
  return object.isObject() && object[key].isString() ? object[key].asString() : "";
}

// The label of a feed given without one: the host part of its address.
std::string DerivedName(const std::string& feed) {
  size_t slashes = feed.find("//");
  if (slashes == std::string::npos) return feed;
  size_t start = slashes + 2;
  size_t end = feed.find('/', start);
  return feed.substr(start, end == std::string::npos ? std::string::npos : end - start);
}

void NameIfMissing(Json::Value* item, const std::string& feed) {
  if (Address(*item, "name").empty()) (*item)["name"] = DerivedName(feed);
}

bool HasFeed(const Json::Value& feeds, const std::string& feed) {
  for (const Json::Value& item : feeds) {
    if (Address(item, "feed") == feed) return true;
  }
  return false;
}

// Asks the feed for its catalogue, from the cache first and then from the
// server; *answer gets the parsed answer. Both asks together take at most
// kFeedProbeSeconds: a person waits on the page for the answer. The
// catalogue library logs why a server failed (down, slow, an error status,
// not JSON, not http/https).
bool ProbeFeed(const std::string& language, const std::string& feed, Json::Value* answer) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point deadline =
      Clock::now() + std::chrono::seconds(KIVOPackageServer::kFeedProbeSeconds);
  for (bool force : {false, true}) {
    const long left = static_cast<long>(
        std::chrono::duration_cast<std::chrono::seconds>(deadline - Clock::now()).count());
    if (left <= 0) {
      PKG_LOG_ERR("%s did not answer within %ld seconds", feed.c_str(),
                  KIVOPackageServer::kFeedProbeSeconds);
      break;
    }
    std::string text;
    if (KIVOPackageServer::PMSQueryPkgServer(language.c_str(), text, feed, force,
                                             Json::Value(Json::objectValue), left) &&
        ParseDocument(text, answer)) {
      return true;
    }
  }
  PKG_LOG_ERR("%s does not answer as a package server", feed.c_str());
  return false;
}

// The "keyrings" a probe's answer publishes; null when it has none.
Json::Value PublishedKeys(const Json::Value& answer) {
  if (answer.isObject() && answer["keyrings"].isArray() && !answer["keyrings"].empty()) {
    return answer["keyrings"];
  }
  return Json::Value();
}

// Loads the list again once the lock is held; false (logged) otherwise.
bool LockAndLoad(const KIVOPackageServer::FeedFileLock& lock, Json::Value* feeds,
                 bool missing_is_empty) {
  if (!lock.held()) {
    PKG_LOG_ERR("Fail to lock %s, %m", PMSFeedFilePath().c_str());
    return false;
  }
  return LoadFeeds(feeds, missing_is_empty);
}

void UpdateKeys(const std::string& feed, const Json::Value& keys) {
  if (!KIVOPackageServer::PMSUpdatePkgServerKey(feed, keys)) {
    PKG_LOG_ERR("Fail to update the keys of %s", feed.c_str());
  }
}

constexpr char kPhp[] = "/usr/bin/php";
constexpr char kPhpOptions[] = "-dopen_basedir=/";

// The code-signing script under the root.
std::string CodesignScript() { return KIVORootPath("/usr/kivo/bin/codesign.php"); }

// The code-signing script's exit statuses (docs/feeds.md).
enum CodesignExit : int {
  kCodesignDone = 0,
  kCodesignUnreadable = 1,  // the file cannot be read (import), or no such key (delete)
  kCodesignNotPublicKey = 2,
  kCodesignSecretKey = 3,
  kCodesignKeyringUnwritable = 4,
};

// The script's exit status for `action` on `argument`.
int RunCodesign(const char* action, const std::string& argument) {
  const std::string script = CodesignScript();
  return KLIBCExec(kPhp, kPhpOptions, script.c_str(), action, argument.c_str());
}

// The host stores an uploaded key file in the root's temporary folder; a
// path anywhere else did not come from the host and is neither read nor
// deleted.
bool IsHostTmpFile(const std::string& path) {
  char folder[PATH_MAX], file[PATH_MAX];
  const std::string tmp = KIVORootPath("/tmp");
  if (path.empty() || path.find('\0') != std::string::npos || !realpath(tmp.c_str(), folder)) {
    return false;
  }
  size_t slash = path.rfind('/');
  if (slash == std::string::npos || path.find("/..") != std::string::npos ||
      !realpath(path.substr(0, slash == 0 ? 1 : slash).c_str(), file)) {
    return false;
  }
  const std::string dir = file, root = folder;
  return (dir == root || dir.compare(0, root.size() + 1, root + "/") == 0) &&
         slash + 1 < path.size();
}

// The answers for an import that did not end with kCodesignDone.
constexpr ToolCodeMapping kImportErrors[] = {
    {kCodesignUnreadable, kErrKeyUnreadable},
    {kCodesignNotPublicKey, kErrKeyNotPublic},
    {kCodesignSecretKey, kErrKeySecret},
    {kCodesignKeyringUnwritable, kErrKeyringUnwritable},
};

}  // namespace

void PackageWebAPI::AddKeyring() {
  const std::string path = request->GetParam("upload_keyring_tmp", "").asString();
  if (!IsHostTmpFile(path)) {
    PKG_LOG_ERR("[%s] is not an uploaded key file", path.c_str());
    return response->SetError(kErrKeyUnreadable, Json::Value());
  }
  const int status = RunCodesign("--import", path);
  // The key file is the upload's alone: it goes whatever the outcome.
  if (KLIBCFileExist(path.c_str()) && unlink(path.c_str()) != 0) {
    PKG_LOG_ERR("Fail to remove %s, %m", path.c_str());
  }
  if (status != kCodesignDone)
    return response->SetError(MapToolCode(kImportErrors, status), Json::Value());
  response->SetSuccess(Json::Value());
}

void PackageWebAPI::ListKeyring() {
  const std::string script = CodesignScript();
  FILE* out = KLIBCPopen(kPhp, "r", kPhpOptions, script.c_str(), "--listkey", nullptr);
  if (!out) {
    PKG_LOG_ERR("%s failed", kPhp);
    return response->SetError(kErrFailed, Json::Value());
  }
  std::vector<char> line(0x20000, 0);
  const bool read = fgets(line.data(), static_cast<int>(line.size()), out) != nullptr;
  if (KLIBCPclose(out) != 0) PKG_LOG_ERR("%s --listkey ended with an error", script.c_str());
  if (!read) {
    PKG_LOG_ERR("Failed to fgets.");
    return response->SetError(kErrFailed, Json::Value());
  }
  Json::Value answer(Json::objectValue);
  if (!KIVOParseJson(line.data(), &answer["items"]) || !answer["items"].isArray()) {
    PKG_LOG_ERR("%s --listkey did not list keys as a JSON array", script.c_str());
    return response->SetError(kErrFailed, Json::Value());
  }
  answer["total"] = answer["items"].size();
  response->SetSuccess(answer);
}

void PackageWebAPI::DelKeyring() {
  Json::Value fingerprints;
  if (!ReadFeedRequest(&fingerprints)) return;
  for (const Json::Value& fpr : fingerprints) {
    const std::string text = fpr.isString() ? fpr.asString() : "";
    if (!HasNoNul(text) || text.empty() || RunCodesign("--delete", text) != kCodesignDone) {
      PKG_LOG_ERR("Delete Keyring failed. fpr=[%s]", text.c_str());
      return response->SetError(kErrFailed, Json::Value());
    }
  }
  response->SetSuccess(Json::Value());
}

bool PackageWebAPI::ReadFeedRequest(Json::Value* parsed) {
  if (!ParseDocument(request->GetParam("list", "").asString(), parsed)) {
    PKG_LOG_ERR("list is not a JSON array or object");
    response->SetError(kErrFailed, Json::Value());
    return false;
  }
  return true;
}

void PackageWebAPI::LoadFeedList() {
  Json::Value feeds;
  if (!LoadFeeds(&feeds, true)) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value answer(Json::objectValue);
  answer["total"] = feeds.size();
  answer["items"] = feeds;
  response->SetSuccess(answer);
}

void PackageWebAPI::AddFeedList() {
  const std::string folder = KIVOPackageServer::PMSFeedFolder();
  if (KIVOFSMkdirP(folder.c_str(), 0777) != 0) {
    PKG_LOG_ERR("Failed to mkdir /usr/kivo/etc/packages, %m");
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value feeds, item;
  if (!LoadFeeds(&feeds, true)) return response->SetError(kErrFailed, Json::Value());
  if (!ReadFeedRequest(&item)) return;
  const std::string feed = Address(item, "feed");
  if (feed.empty()) return response->SetError(kErrBadParameter, Json::Value());
  NameIfMissing(&item, feed);
  if (HasFeed(feeds, feed)) return response->SetError(kErrFeedExists, Json::Value());
  Json::Value probed;
  if (!ProbeFeed(request->GetUILanguage(), feed, &probed)) {
    return response->SetError(kErrFeedNotServer, Json::Value());
  }
  // The probe may take seconds: the list is read again under the lock, so a
  // change made meanwhile is kept and a feed added meanwhile is not doubled.
  KIVOPackageServer::FeedFileLock lock;
  if (!LockAndLoad(lock, &feeds, true)) {
    return response->SetError(kErrFailed, Json::Value());
  }
  if (HasFeed(feeds, feed)) return response->SetError(kErrFeedExists, Json::Value());
  feeds.append(item);
  if (!SaveFeeds(feeds)) return response->SetError(kErrFailed, Json::Value());
  Json::Value keys = PublishedKeys(probed);
  Json::Value answer;
  if (!keys.isNull()) answer["has_keyrings"] = true;
  // A feed that answers but lists nothing is added, and the answer says so:
  // the page tells the administrator rather than showing an empty feed.
  answer["packages"] = static_cast<Json::Int64>(KIVOPackageServer::PMSListedEntryCount(probed));
  UpdateKeys(feed, keys);
  response->SetSuccess(answer);
}

// Applies the change to every element whose address is `orifeed`; a clash
// with another element's address answers 4591.
bool PackageWebAPI::ApplyFeedChange(Json::Value* feeds, const Json::Value& change) {
  const std::string orifeed = Address(change, "orifeed"), feed = Address(change, "feed");
  for (Json::Value& item : *feeds) {
    const std::string current = Address(item, "feed");
    if (current == orifeed) {
      item["name"] = change["name"];
      item["feed"] = feed;
    } else if (current == feed) {
      response->SetError(kErrFeedExists, Json::Value());
      return false;
    }
  }
  return true;
}

void PackageWebAPI::EditFeedList() {
  Json::Value feeds, change;
  if (!LoadFeeds(&feeds, false)) return response->SetError(kErrFailed, Json::Value());
  if (!ReadFeedRequest(&change)) return;
  const std::string orifeed = Address(change, "orifeed"), feed = Address(change, "feed");
  if (feed.empty() || orifeed.empty()) return response->SetError(kErrFailed, Json::Value());
  NameIfMissing(&change, feed);
  Json::Value check = feeds;
  if (!ApplyFeedChange(&check, change)) return;
  Json::Value probed;
  if (HasFeed(feeds, orifeed) && !ProbeFeed(request->GetUILanguage(), feed, &probed)) {
    return response->SetError(kErrFeedNotServer, Json::Value());
  }
  KIVOPackageServer::FeedFileLock lock;
  if (!LockAndLoad(lock, &feeds, false)) {
    return response->SetError(kErrFailed, Json::Value());
  }
  const bool changed = HasFeed(feeds, orifeed);
  if (!ApplyFeedChange(&feeds, change)) return;
  if (!SaveFeeds(feeds)) return response->SetError(kErrFailed, Json::Value());
  // The old address's keys vouch for nothing once it is gone from the list.
  if (changed && orifeed != feed) {
    UpdateKeys(orifeed, Json::Value());
    KIVOPackageServer::PMSForgetSourceStatus(orifeed);
  }
  if (changed) UpdateKeys(feed, PublishedKeys(probed));
  Json::Value answer;
  if (changed) {
    answer["packages"] = static_cast<Json::Int64>(KIVOPackageServer::PMSListedEntryCount(probed));
  }
  response->SetSuccess(answer);
}

void PackageWebAPI::DelFeedList() {
  Json::Value feeds, gone;
  KIVOPackageServer::FeedFileLock lock;
  if (!LockAndLoad(lock, &feeds, false)) {
    return response->SetError(kErrFailed, Json::Value());
  }
  if (!ReadFeedRequest(&gone)) return;
  Json::Value kept(Json::arrayValue);
  for (const Json::Value& item : feeds) {
    const std::string feed = Address(item, "feed");
    bool drop = false;
    for (const Json::Value& address : gone) drop = drop || (address.isString() && address == feed);
    if (!drop) {
      kept.append(item);
    } else {
      UpdateKeys(feed, Json::Value());
      KIVOPackageServer::PMSForgetSourceStatus(feed);
    }
  }
  if (!SaveFeeds(kept)) return response->SetError(kErrFailed, Json::Value());
  response->SetSuccess(Json::Value());
}

}  // namespace KIVO_PACKAGE
