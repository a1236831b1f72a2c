// The package servers' catalogue merged with what this appliance knows:
// installed versions and upgrades, running operations, download progress,
// the addresses of running packages; and the update badge.

#include <cstdlib>
#include <deque>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string_view>
#include <unistd.h>
#include <vector>

#include "klibc/json_text.h"
#include "log_line.h"
#include "package_status.h"
#include "package_webapi.h"
#include "pkgserver/badge.h"
#include "pkgserver/catalogue_listing.h"
#include "pkgserver/server_image.h"
#include "pkgtool/package_origin.h"
#include "pkgtool/pms.h"
#include "task_record.h"

namespace KIVO_PACKAGE {

namespace {

// A flag parameter: true, "true" or a nonzero number; anything else is false.
bool FlagParam(APIRequest* request, const char* name) {
  Json::Value v = request->GetParam(name, "");
  if (v.isBool()) return v.asBool();
  if (v.isIntegral()) return v.asInt64() != 0;
  return v.isString() && (v.asString() == "true" || v.asString() == "1");
}

bool IsTrue(const Json::Value& v) { return v.isBool() && v.asBool(); }

// The addresses of a running package's own web interface, null when it has
// neither port nor path.
Json::Value PackageUrls(const PackageInfo& p) {
  int port = p.getAdminPort();
  std::string path = p.get("adminurl");
  if (port == 0 && path.empty()) return Json::Value();
  std::string base = RequestHost();
  if (port != 0) base += ":" + std::to_string(port);
  if (!path.empty()) base += (path[0] == '/' ? "" : "/") + path;
  Json::Value urls(Json::arrayValue);
  std::string protocols = p.get("adminprotocol").empty() ? "http" : p.get("adminprotocol");
  for (size_t pos = 0; pos < protocols.size();) {
    size_t end = protocols.find_first_of(" ,", pos);
    if (end == std::string::npos) end = protocols.size();
    if (end > pos) urls.append(protocols.substr(pos, end - pos) + "://" + base);
    pos = end + 1;
  }
  return urls;
}

// Marks `overlay` as an upgrade of installed package `p` to the server's
// `version` unless the installed version is restricted; true when it did.
// Only the catalogue the package came from offers its upgrades: a newer
// version from another catalogue (`source`) is no upgrade, and the overlay
// names the package's origin in "other_origin" instead, for an
// administrator who may switch it to this source. The origin is read only
// for a newer version: most installed packages are up to date.
bool MarkUpgrade(const PackageInfo& p, const PMSPackageOrigin& source,
                 const PMSThirdPartyLimits& limits, const std::string& version,
                 Json::Value& overlay) {
  PackageBasicInfo have(p.getId(), p.getVersion());
  if (!have.compare(PackageBasicInfo(overlay["package"].asString(), version), PKG_VER_LT) ||
      limits.Restricts(p.getId(), p.getVersion())) {
    return false;
  }
  const PMSPackageOrigin installed_from = PMSInstalledOrigin(p.getId());
  if (!PMSSameSource(installed_from, source)) {
    overlay["other_origin"] = PMSSourceText(installed_from);
    return false;
  }
  overlay["blupgrade"] = true;
  return true;
}

// Lays the appliance's state (an overlay object of the members it sets)
// over the text of a listing entry, with one writer per request: making one
// costs more than an entry.
class EntryOverlay {
 public:
  EntryOverlay() : writer_(KIVONewJsonWriter()) {}

  // `text` (an object written by KIVONewJsonWriter()) with the members of
  // `overlay` but "package" in place of its own or added, as if they had
  // been set on the parsed entry: the writer puts members in name order, so
  // the entry's members are merged with the overlay's by name and only the
  // overlay's values are written.
  std::string Apply(std::string_view text, const Json::Value& overlay) {
    std::vector<std::pair<std::string_view, std::string_view>> members;
    if (!SplitMembers(text, &members)) return Reparsed(text, overlay);
    std::string out = "{";
    auto member = members.begin();
    for (const std::string& name : overlay.getMemberNames()) {
      if (name == "package") continue;
      for (; member != members.end() && member->first < name; ++member)
        Append(member->second, &out);
      if (member != members.end() && member->first == name) ++member;
      // The overlay's names are the plain ones of this file ("status",
      // "url", ...): quoted as they stand, as the writer quotes them.
      Append("\"" + name + "\":" + Written(overlay[name]), &out);
    }
    for (; member != members.end(); ++member) Append(member->second, &out);
    return out + "}";
  }

 private:
  static void Append(std::string_view member, std::string* out) {
    if (out->size() > 1) *out += ',';
    out->append(member.data(), member.size());
  }

  // The members of object text `text` as (name, member text) in their
  // order; false for text this cannot split: a member name with an escape
  // (its order is that of the unescaped name) or not an object.
  static bool SplitMembers(std::string_view all,
                           std::vector<std::pair<std::string_view, std::string_view>>* members) {
    if (all.size() < 2 || all.front() != '{' || all.back() != '}') return false;
    for (size_t i = 1, end = all.size() - 1; i < end; ++i) {
      const size_t start = i;
      for (int depth = 0; i < end && (depth > 0 || all[i] != ','); ++i) {
        if (all[i] == '{' || all[i] == '[') ++depth;
        if (all[i] == '}' || all[i] == ']') --depth;
        if (all[i] != '"') continue;
        for (++i; i < end && all[i] != '"'; ++i) i += all[i] == '\\';
      }
      const std::string_view member = all.substr(start, i - start);
      const size_t quote = member.find('"', 1);
      if (member.size() < 2 || member[0] != '"' || quote == std::string_view::npos ||
          member.substr(0, quote).find('\\') != std::string_view::npos) {
        return false;
      }
      members->emplace_back(member.substr(1, quote - 1), member);
    }
    return true;
  }

  // The general way for text SplitMembers refuses: parsed, changed, written.
  std::string Reparsed(std::string_view text, const Json::Value& overlay) {
    Json::Value entry;
    if (!KIVOParseJson(text, &entry, JsonSyntax::Lenient) || !entry.isObject()) {
      // Listing texts are checked against their file's checksum, so this is
      // a fault of ours: the entry goes out without the appliance's state.
      PKG_LOG_ERR("A listing entry is not a JSON object: %.80s", std::string(text).c_str());
      return std::string(text);
    }
    for (const std::string& name : overlay.getMemberNames()) entry[name] = overlay[name];
    return Written(entry);
  }

  std::string Written(const Json::Value& value) {
    std::ostringstream out;
    writer_->write(value, &out);
    return out.str();
  }

  std::unique_ptr<Json::StreamWriter> writer_;
};

// The answer {"blupgrade": B, "data": [...], "recommend": [...], "total": N}
// as text, from the entries' texts: the members in name order and written
// compactly, as KIVONewJsonWriter() writes an object. "recommend" holds, for
// each recommended name in order, the last listed entry of that name, and
// is left out when none is listed.
class AnswerText {
 public:
  explicit AnswerText(const std::vector<std::string>& recommend) : recommend_(recommend) {
    for (const std::string& name : recommend) last_of_[name] = kNone;
  }
  // `text` must live until Finish.
  void Add(const std::string& name, std::string_view text) {
    auto recommended = last_of_.find(name);
    if (recommended != last_of_.end()) recommended->second = data_.size();
    bytes_ += text.size() + 1;
    data_.push_back(text);
  }
  void AddOwned(const std::string& name, std::string text) {
    owned_.push_back(std::move(text));
    Add(name, owned_.back());
  }
  std::string Finish(bool any_upgrade) const {
    std::string chosen;
    for (const std::string& name : recommend_) {
      size_t listed = last_of_.at(name);
      if (listed == kNone) continue;
      chosen += chosen.empty() ? ",\"recommend\":[" : ",";
      chosen.append(data_[listed].data(), data_[listed].size());
    }
    if (!chosen.empty()) chosen += ']';
    std::string out;
    out.reserve(bytes_ + chosen.size() + 80);
    out += any_upgrade ? "{\"blupgrade\":true,\"data\":[" : "{\"blupgrade\":false,\"data\":[";
    for (size_t i = 0; i < data_.size(); ++i) {
      if (i) out += ',';
      out.append(data_[i].data(), data_[i].size());
    }
    out += ']';
    out += chosen;
    out += ",\"total\":" + std::to_string(data_.size()) + "}";
    return out;
  }

 private:
  static constexpr size_t kNone = SIZE_MAX;

  const std::vector<std::string>& recommend_;
  std::map<std::string, size_t> last_of_;
  std::vector<std::string_view> data_;
  std::deque<std::string> owned_;  // texts of annotated entries
  size_t bytes_ = 0;
};

}  // namespace

void PackageWebAPI::AnnotateInstalled(const PackageTasks& tasks, const PackageInfo& p,
                                      Json::Value& entry) {
  const std::string name = entry["package"].asString();
  const PackageState state = ReadPackageState(tasks, pkgMgr, name, &p, BrokenCheck::kYes);
  entry["status"] = state.status;
  if (state.progress != -1.0) entry["installing_progress"] = state.progress;
  if (!state.running) return;
  entry["nvx_apps"] = p.get("nvx_apps");
  Json::Value urls = PackageUrls(p);
  if (!urls.isNull()) entry["url"] = urls;
}

void PackageWebAPI::AnnotateDownload(const PackageTasks& tasks, Json::Value& entry) {
  std::unique_ptr<NVX::Task> task(tasks.Get(kDownloadPrefix + entry["package"].asString()));
  // Read through a const value: looking a member up must not add it, as
  // "info" is the task's data as stored.
  const Json::Value data = task ? task->getProperty("data") : Json::Value();
  if (data.isNull()) return;
  if (IsTrue(data["blqinst"]) &&
      (task->isFinished() || (data["pid"].isInt() && !TaskProcessAlive(data)))) {
    return;
  }
  entry["info"] = data;
  bool installing = IsTrue(data["installing"]);
  if (data.isMember("installing")) {
    installing = installing && !task->isFinished() && data["pid"].isInt() && TaskProcessAlive(data);
    entry["info"]["installing"] = installing;
  }
  if (installing) {
    double progress = PMSGetProgress(entry["package"].asString());
    if (progress != -1.0) entry["progress"] = progress;
  } else {
    entry["progress"] = DownloadTaskProgress(*task, data);
  }
}

void PackageWebAPI::ListServerPackage() {
  const bool others = FlagParam(request, "blloadothers");
  const std::string language = request->GetUILanguage();
  // The catalogue comes rendered as far as it does not depend on this
  // appliance (catalogue_listing.h): the entries of installed packages and
  // of downloads get the appliance's state laid over their text, the others
  // are copied as they are.
  KIVOPackageServer::CatalogueListing listing;
  if (!KIVOPackageServer::PMSListCatalogue(
          others ? KIVOPackageServer::ListingSide::kFeeds : KIVOPackageServer::ListingSide::kVendor,
          FlagParam(request, "blforcereload"), language, &listing)) {
    return;
  }
  std::map<std::string, PackageInfo> installed;
  // Without the installed packages the catalogue shows every one as not
  // installed; the log says why.
  if (!pkgMgr.init() || !pkgMgr.enumPackageInfoMap(installed, language, ~0ULL)) {
    PKG_LOG_ERR("Failed to read the installed packages [%d]", pkgMgr.getResult());
  }
  NVX::TaskMgr mgr(kTaskOwner);
  const std::vector<std::string> listed = mgr.listTasks(kPackageTaskPrefix);
  const PackageTasks tasks(mgr, std::set<std::string>(listed.begin(), listed.end()));
  const PMSThirdPartyLimits limits;
  EntryOverlay entries;
  AnswerText answer(listing.recommend);
  bool any_upgrade = false;
  for (KIVOPackageServer::ListingEntry& e : listing.entries) {
    if (e.has_version && limits.Restricts(e.name, e.version)) continue;
    auto p = installed.find(e.name);
    if (p != installed.end() || tasks.MayHave(kDownloadPrefix + e.name)) {
      Json::Value overlay(Json::objectValue);
      overlay["package"] = e.name;
      if (p != installed.end()) {
        // The entries of installed packages have always had "version", null
        // when the server gave none (rendering adds it beside an icon).
        if (!e.has_version && e.icon.empty()) overlay["version"] = Json::Value();
        any_upgrade =
            MarkUpgrade(p->second, listing.sources[e.source], limits, e.version, overlay) ||
            any_upgrade;
        AnnotateInstalled(tasks, p->second, overlay);
      }
      AnnotateDownload(tasks, overlay);
      answer.AddOwned(e.name, entries.Apply(e.text, overlay));
    } else {
      answer.Add(e.name, e.text);
    }
    if (!e.icon.empty()) KIVOPackageTool::PMSQueueServerImage(e.name, e.version, e.icon);
  }
  response->SetSuccessText(answer.Finish(any_upgrade));
}

void PackageWebAPI::CheckUpdate() {
  KIVOPackageTool::updateBadgeCount(false);
  response->SetSuccess(Json::Value(true));
}

}  // namespace KIVO_PACKAGE
