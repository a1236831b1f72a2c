#include "tools/kivoctl/server_install.h"

#include <algorithm>
#include <iostream>
#include <memory>
#include <unistd.h>

#include "pkgserver/catalogue.h"
#include "pkgserver/download.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"
#include "taskmgr/task_names.h"

namespace {

constexpr char kLanguage[] = "enu";
constexpr char kUser[] = "root";

std::string Text(const Json::Value& v) { return v.isString() ? v.asString() : ""; }

// The newest entry of `id` in the vendor's catalogue, or in the catalogue of
// `feed` (which must be listed), fetched afresh; false with `*error`.
bool FindOffer(const std::string& id, const std::string& feed, Json::Value& entry,
               std::string* error) {
  Json::Value answer;
  if (feed.empty()) {
    if (!KIVOPackageServer::PMSQueryKivoPkgServer(true, kLanguage, answer)) {
      *error = "the vendor's catalogue cannot be read";
      return false;
    }
  } else {
    const std::vector<std::string> feeds = KIVOPackageServer::PMSFeedUrls();
    if (std::find(feeds.begin(), feeds.end(), feed) == feeds.end()) {
      *error = feed + " is not in the feed list";
      return false;
    }
    if (!KIVOPackageServer::PMSQueryFeedServer(feed, true, kLanguage, answer)) {
      *error = "the catalogue of the feed " + feed + " cannot be read";
      return false;
    }
  }
  if (KIVOPackageServer::PMSNewestEntry(answer, id, entry) && !Text(entry["link"]).empty())
    return true;
  *error = (feed.empty() ? std::string("the vendor's catalogue") : "the feed " + feed) +
           " offers no " + id;
  return false;
}

}  // namespace

bool KivoctlDownloadAndInstall(const std::string& id, const Json::Value& entry, bool run,
                               const std::string& volume, const PMSInstallChoices& choices,
                               std::string& message, int& code) {
  const std::string link = Text(entry["link"]), md5 = Text(entry["md5"]);
  const uint64_t size = entry["size"].isUInt64() ? entry["size"].asUInt64() : 0;
  code = 0;
  if (KIVOPackageServer::IsInstalling(id)) {
    message = "a download of it is under way";
    return false;
  }
  std::string target = volume, folder;
  if (target.empty() && !PMSGetPackageVol(id, target)) target.clear();
  if (!PMSCreateDownloadTmpDir(target, id, static_cast<int64_t>(size), folder)) {
    message = "no room for the download";
    return false;
  }
  // The download runs in the same task the desktop's downloads use, so the
  // desktop sees it and never starts a second download of the same package.
  NVX::TaskMgr mgr(KIVOPackageTasks::kTaskOwner);
  std::unique_ptr<NVX::Task> task(mgr.createTask(KIVOPackageTasks::kDownloadPrefix + id));
  if (!task || !KIVOPackageServer::InitDownload(task.get(), id, size, link, folder, true, getpid(),
                                                choices)) {
    (void)KIVOPackageServer::PMSRemoveDownloadDir(folder);
    message = "the download task cannot be written";
    return false;
  }
  std::string path;
  bool ok =
      KIVOPackageServer::DownloadPackage(task.get(), kUser, id, link, md5, true, folder, kLanguage,
                                         path) &&
      KIVOPackageServer::Install(task.get(), kUser, target, id, folder, run, "", false, kLanguage);
  if (ok) return true;
  // Both steps leave their reason in the task.
  Json::Value error = task->getProperty("data")["error"];
  message = error["message"].isString() ? error["message"].asString() : "the install failed";
  code = error["result"].isInt() ? error["result"].asInt() : 0;
  return false;
}

int KivoctlInstallServer(const std::vector<std::string>& args) {
  std::string id, feed, volume;
  bool run = false;
  PMSInstallChoices choices;
  for (size_t i = 0; i < args.size(); ++i) {
    const bool has_value = i + 1 < args.size();
    if (args[i] == "--feed" && has_value) {
      feed = args[++i];
    } else if (args[i] == "--volume" && has_value) {
      volume = args[++i];
    } else if (args[i] == "--run") {
      run = true;
    } else if (args[i] == "--switch-origin") {
      choices.change = PMSOriginChange::kAllow;
    } else if (args[i] == "--without-data-copy") {
      choices.without_data_copy = true;
    } else if (id.empty() && args[i].compare(0, 2, "--") != 0) {
      id = args[i];
    } else {
      id.clear();
      break;
    }
  }
  if (!PMSIsValidPackageId(id)) {
    std::cerr << "kivoctl: usage: kivoctl install-server ID [--feed URL] [--volume /volumeN] "
                 "[--run] [--switch-origin] [--without-data-copy]\n";
    return 2;
  }
  Json::Value entry;
  std::string message;
  int code = 0;
  if (!FindOffer(id, feed, entry, &message) ||
      !KivoctlDownloadAndInstall(id, entry, run, volume, choices, message, code)) {
    std::cerr << "kivoctl: " << id << ": " << message
              << (code ? " [" + std::to_string(code) + "]" : "") << "\n";
    return 1;
  }
  std::cout << "installed " << id << " " << Text(entry["version"]) << " from "
            << Text(entry["link"]) << "\n";
  return 0;
}
