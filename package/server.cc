// The package servers' catalogue merged with what this appliance knows:
// installed versions and upgrades, running operations, download progress,
// the addresses of running packages; and the update badge.

#include <cstdlib>
#include <map>
#include <memory>
#include <set>
#include <unistd.h>
#include <vector>

#include "log_line.h"
#include "package_webapi.h"
#include "pkgserver/badge.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/server_image.h"
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

std::string Text(const Json::Value& v) { return v.isString() ? v.asString() : ""; }

bool IsTrue(const Json::Value& v) { return v.isBool() && v.asBool(); }

// The status of an installed package that does not run, from the package
// tool's reason.
const char* NotRunningStatus(int result) {
  switch (result) {
    case 255:
      return "non_installed";
    case 256:
    case 263:
      return "NA";
    case 150:
    case 258:
      return "broken";
    case 259:
      return "version_limit";
    default:
      return "stop";
  }
}

// "nas.local:5000" -> "nas.local": the browser's port is not the package's.
std::string HostWithoutPort() {
  const char* env = getenv("HTTP_HOST");
  std::string host = env ? std::string(env).substr(0, 255) : "";
  return host.substr(0, host.find(':'));
}

// The addresses of a running package's own web interface, null when it has
// neither port nor path.
Json::Value PackageUrls(const PackageInfo& p) {
  int port = p.getAdminPort();
  std::string path = p.get("adminurl");
  if (port == 0 && path.empty()) return Json::Value();
  std::string base = HostWithoutPort();
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

// Task `id` when the request's one listing of the package tasks holds it. A
// catalogue has thousands of entries and few of them have a task: asking the
// task store once per request instead of once per entry keeps the listing's
// cost in reading the catalogue.
NVX::Task* ListedTask(NVX::TaskMgr& mgr, const std::set<std::string>& listed,
                      const std::string& id) {
  return listed.count(id) ? GetTaskWithTaskMgr(mgr, id) : nullptr;
}

}  // namespace

bool PackageWebAPI::AnnotateInstalled(NVX::TaskMgr& mgr, const std::set<std::string>& tasks,
                                      const PackageInfo& p, Json::Value& entry) {
  const std::string name = entry["package"].asString();
  std::unique_ptr<NVX::Task> task(ListedTask(mgr, tasks, kStartStopPrefix + name));
  if (task) {
    Json::Value data = task->getProperty("data");
    if (data.isMember("status") && TaskProcessAlive(data)) {
      entry["status"] = data["status"];
      return true;
    }
    EndStaleTask(*task, data);
  }
  task.reset(ListedTask(mgr, tasks, kDownloadPrefix + name));
  if (task) {
    Json::Value data = task->getProperty("data");
    if (IsTrue(data["installing"]) && !task->isFinished() && data["pid"].isInt()) {
      if (TaskProcessAlive(data)) {
        entry["status"] = data.isMember("status") ? data["status"] : Json::Value("installing");
        double progress = PMSGetProgress(name);
        if (progress != -1.0) entry["installing_progress"] = progress;
        return true;
      }
      if (data["pid"].asInt() != 0) EndStaleTask(*task, data);
    }
  }
  task.reset(ListedTask(mgr, tasks, kUninstallPrefix + name));
  if (task) {
    Json::Value data = task->getProperty("data");
    if (data.isMember("status") && TaskProcessAlive(data)) {
      entry["status"] = "uninstalling";
      return true;
    }
    EndStaleTask(*task, data);
  }
  bool running = false;
  entry["status"] = "NA";
  if (pkgMgr.getServiceStatus(p, running, true) && running) {
    entry["status"] = "running";
    entry["nvx_apps"] = p.get("nvx_apps");
    Json::Value urls = PackageUrls(p);
    if (!urls.isNull()) entry["url"] = urls;
  } else {
    entry["status"] = NotRunningStatus(pkgMgr.getResult());
  }
  return false;
}

void PackageWebAPI::AnnotateDownload(NVX::TaskMgr& mgr, const std::set<std::string>& tasks,
                                     Json::Value& entry) {
  std::unique_ptr<NVX::Task> task(
      ListedTask(mgr, tasks, kDownloadPrefix + entry["package"].asString()));
  Json::Value data = task ? task->getProperty("data") : Json::Value();
  if (data.isNull()) return;
  if (IsTrue(data["blqinst"]) &&
      (task->isFinished() || (data["pid"].isInt() && !TaskProcessAlive(data)))) {
    return;
  }
  if (data.isMember("installing")) {
    data["installing"] = !task->isFinished() && IsTrue(data["installing"]) && data["pid"].isInt() &&
                         TaskProcessAlive(data);
  }
  entry["info"] = data;
  if (IsTrue(data["installing"])) {
    double progress = PMSGetProgress(entry["package"].asString());
    if (progress != -1.0) entry["progress"] = progress;
  } else {
    entry["progress"] = DownloadTaskProgress(*task, data);
  }
}

void PackageWebAPI::ListServerPackage() {
  const bool force = FlagParam(request, "blforcereload");
  const bool others = FlagParam(request, "blloadothers");
  const std::string language = request->GetUILanguage();
  Json::Value answer;
  bool ok = others ? KIVOPackageServer::PMSQueryOtherPkgServer(force, language.c_str(), answer)
                   : KIVOPackageServer::PMSQueryKivoPkgServer(force, language.c_str(), answer);
  if (!ok) return;
  const bool object_form = answer.isObject() && !answer.empty();
  if (object_form && (!answer.isMember("packages") || !answer.isMember("recommend"))) return;
  if (!object_form && !answer.isArray()) return;
  Json::Value& list = object_form ? answer["packages"] : answer;
  if (!list.isArray()) return;
  std::map<std::string, PackageInfo> installed;
  // Without the installed packages the catalogue shows every one as not
  // installed; the log says why.
  if (!pkgMgr.init() || !pkgMgr.enumPackageInfoMap(installed, language, ~0ULL)) {
    PKG_LOG_ERR("Failed to read the installed packages [%d]", pkgMgr.getResult());
  }
  NVX::TaskMgr mgr(kTaskOwner);
  const std::vector<std::string> listed = mgr.listTasks("@KIVOPKG_");
  const std::set<std::string> tasks(listed.begin(), listed.end());
  const PMSThirdPartyLimits limits;
  // The recommendation slot of each recommended name (its first place).
  std::map<std::string, Json::ArrayIndex> slot_of;
  Json::Value slots(Json::arrayValue), data(Json::arrayValue);
  if (object_form && !others && answer["recommend"].isArray()) {
    const Json::Value& recommend = answer["recommend"];
    for (Json::ArrayIndex i = 0; i < recommend.size(); ++i) {
      if (recommend[i].isString()) slot_of.emplace(recommend[i].asString(), i);
    }
    slots.resize(recommend.size());
  }
  bool any_upgrade = false;
  for (Json::Value& element : list) {
    if (!element.isObject() || !element["package"].isString()) continue;
    // The answer is this request's own: its entries move into the result.
    Json::Value entry = std::move(element);
    const std::string name = entry["package"].asString();
    entry["id"] = name;
    if (entry.isMember("version") && limits.Restricts(name, Text(entry["version"]))) continue;
    entry["blupgrade"] = false;
    entry["source"] = others ? "others" : "kivo";
    auto p = installed.find(name);
    if (p != installed.end()) {
      PackageBasicInfo have(p->second.getId(), p->second.getVersion());
      if (have.compare(PackageBasicInfo(name, Text(entry["version"])), PKG_VER_LT) &&
          !limits.Restricts(p->second.getId(), p->second.getVersion())) {
        entry["blupgrade"] = true;
        any_upgrade = true;
      }
      AnnotateInstalled(mgr, tasks, p->second, entry);
    }
    RewriteDependencies(entry, "conf_deppkgs", "deppkgs", "deppkgs");
    RewriteDependencies(entry, "conf_conxpkgs", "conflictpkgs", "conflictpkgs");
    if (entry["icon"].isString() && !entry["icon"].asString().empty()) {
      KIVOPackageTool::PMSGetServerImage(others ? "AVAIL/OTHER" : "AVAIL/KIVO", name.c_str(),
                                         Text(entry["version"]).c_str(), "thumb_72.png",
                                         entry["icon"].asCString(), nullptr, 0);
    }
    AnnotateDownload(mgr, tasks, entry);
    auto slot = slot_of.find(name);
    if (slot != slot_of.end()) slots[slot->second] = entry;
    data.append(std::move(entry));
  }
  Json::Value result(Json::objectValue);
  Json::Value chosen(Json::arrayValue);
  for (const Json::Value& slot : slots) {
    if (!slot.isNull()) chosen.append(slot);
  }
  if (!chosen.empty()) result["recommend"] = chosen;
  result["total"] = data.size();
  result["data"] = std::move(data);
  result["blupgrade"] = any_upgrade;
  response->SetSuccess(std::move(result));
}

void PackageWebAPI::CheckUpdate() {
  KIVOPackageTool::updateBadgeCount(false);
  response->SetSuccess(Json::Value(true));
}

}  // namespace KIVO_PACKAGE
