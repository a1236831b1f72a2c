// The package server library's transfer of a package file into its
// download task (the web API's request and worker are package/download.cc).

#include "pkgserver/download.h"

#include <algorithm>
#include <csignal>
#include <ctime>
#include <memory>
#include <string>
#include <syslog.h>
#include <unistd.h>
#include <utility>

#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/feed_keys.h"
#include "pkgserver/server_config.h"
#include "pkgserver/server_net.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "taskmgr/task_names.h"

#include <strings.h>

#define DOWNLOAD_LOG(fmt, ...) syslog(LOG_ERR, "%s:%d " fmt, "pkgdownload", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageServer {

namespace {

// Set by SIGTERM in a worker (RegisterCancel); nothing else writes it.
volatile sig_atomic_t g_canceled = 0;

void OnTerm(int) { g_canceled = 1; }

constexpr double kProgressInterval = 0.25;  // seconds between progress writes

double Now() {
  struct timespec t;
  clock_gettime(CLOCK_MONOTONIC, &t);
  return static_cast<double>(t.tv_sec) + t.tv_nsec / 1e9;
}

// Writes to the task unless it is gone: a cancel removes the task, and a
// write afterwards would leave stray properties behind.
bool TaskExists(NVX::Task* task) {
  NVX::TaskMgr mgr(task->getOwner());
  return mgr.hasTask(task->getTaskId());
}

struct ProgressWriter {
  NVX::Task* task;
  double last = 0;

  static void Report(void* context, uint64_t have, uint64_t total) {
    auto* self = static_cast<ProgressWriter*>(context);
    double now = Now();
    if (total == 0 || now - self->last < kProgressInterval) return;
    self->last = now;
    // 1.0 means "complete and checked"; until then stay below it.
    double fraction = std::min(0.99, static_cast<double>(have) / static_cast<double>(total));
    // Progress is advisory: a failed write is retried with the next block.
    if (TaskExists(self->task) && !self->task->setProperty("progress", fraction)) self->last = 0;
  }
  static bool Canceled(void*) { return isCanceled(); }
};

// Writes `data` (and "progress" when it is not negative) in one transaction.
// False, with a log line, when the task store refused it.
bool WriteTaskData(NVX::Task* task, const Json::Value& data, double progress) {
  task->beginUpdate();
  bool ok = task->setProperty("data", data);
  if (progress >= -1.0) ok = task->setProperty("progress", progress) && ok;
  ok = task->endUpdate() && ok;
  if (!ok) DOWNLOAD_LOG("cannot write task %s", task->getTaskId().c_str());
  return ok;
}

// `dependent`: for an upgrade refused because it would break a running
// package (269), that package's id.
void Fail(NVX::Task* task, int code, const std::string& message, int result = 0,
          const std::string& dependent = "") {
  if (isCanceled() || !TaskExists(task)) return;
  Json::Value data = task->getProperty("data");
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  data["status"] = "failed";
  data["installing"] = false;
  data["error"]["code"] = code;
  data["error"]["message"] = message;
  if (result) data["error"]["result"] = result;
  if (!dependent.empty()) data["error"]["deppkg"] = dependent;
  // The log line says what failed even when the task cannot.
  DOWNLOAD_LOG("%s: %s", task->getTaskId().c_str(), message.c_str());
  if (!WriteTaskData(task, data, -1.0) || !task->finish(false)) {
    DOWNLOAD_LOG("cannot record the failure in task %s", task->getTaskId().c_str());
  }
}

// One update of "status" and "installing" (and "progress" when given).
[[nodiscard]] bool SetStatus(NVX::Task* task, const char* status, bool installing,
                             double progress = -2.0) {
  Json::Value data = task->getProperty("data");
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  data["status"] = status;
  data["installing"] = installing;
  data["pid"] = static_cast<int>(getpid());
  return WriteTaskData(task, data, progress >= 0 ? progress : -2.0);
}

// Puts into the task's data which key signed the file and who vouched for
// it ("signature"), the source whose catalogue listed the link ("origin", in
// words) and the feed that did ("feed", "" for another source), so that the
// desktop can show them with the outcome.
[[nodiscard]] bool RecordSignature(NVX::Task* task, const PMSPackageOrigin& origin,
                                   const std::string& note) {
  if (!TaskExists(task)) return false;
  Json::Value data = task->getProperty("data");
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  data["origin"] = PMSSourceText(origin);
  data["feed"] = origin.kind == PMSOriginKind::kFeed ? origin.feed : "";
  data["signature"] = note;
  return WriteTaskData(task, data, -2.0);
}

// The sha256 a catalogue gives for `link`, "" when none does.
std::string CatalogueSha256(const std::string& name, const std::string& link,
                            const std::string& language) {
  for (bool vendor : {true, false}) {
    Json::Value entry;
    if (PMSFindServerEntry(name, vendor, language, entry) && entry["link"].isString() &&
        entry["link"].asString() == link && entry["sha256"].isString()) {
      return entry["sha256"].asString();
    }
  }
  return "";
}

bool SameHex(const std::string& a, const std::string& b) {
  return a.size() == b.size() && strcasecmp(a.c_str(), b.c_str()) == 0;
}

// Why a transfer failed: the code and message its task gets.
struct TransferFailure {
  int code = 0;
  std::string message;
};

// The transfer itself. False with `*failure` when it failed: the caller
// removes the download folder before the task says so, so that a client
// that sees the task finished finds nothing left of it.
bool Transfer(NVX::Task* task, const std::string& name, const std::string& link,
              const std::string& md5, const std::string& sha256, uint64_t size,
              const std::string& path, TransferFailure* failure) {
  auto fail = [failure](int code, std::string message) {
    *failure = {code, std::move(message)};
    return false;
  };
  std::string error;
  const PackageServerNetOps* net = PMSServerNetOps(&error);
  if (!net) return fail(PMS_DL_ERR_NETWORK, error);
  PkgServerConfig config = PMSLoadServerConfig();
  ProgressWriter writer{task};
  HttpDownload d;
  d.url = link;
  d.path = path;
  d.retries = config.download_retries;
  d.want_md5 = !md5.empty();
  d.want_sha256 = !sha256.empty();
  d.progress = ProgressWriter::Report;
  d.canceled = ProgressWriter::Canceled;
  d.context = &writer;
  if (net->download(config.DownloadLimits(size), d)) {
    if (d.want_md5 && !SameHex(md5, d.md5_hex))
      return fail(PMS_DL_ERR_CHECKSUM,
                  "the file's md5 " + d.md5_hex + " differs from the catalogue's " + md5);
    if (d.want_sha256 && !SameHex(sha256, d.sha256_hex))
      return fail(PMS_DL_ERR_CHECKSUM,
                  "the file's sha256 " + d.sha256_hex + " differs from the catalogue's " + sha256);
    if (size && d.bytes != size)
      return fail(d.bytes > size ? PMS_DL_ERR_TOO_LARGE : PMS_DL_ERR_NETWORK,
                  "the file has " + std::to_string(d.bytes) + " bytes, the catalogue says " +
                      std::to_string(size));
    return true;
  }
  DOWNLOAD_LOG("%s from %s: %s", name.c_str(), link.c_str(), d.error.c_str());
  using O = HttpDownload::Outcome;
  int code = d.outcome == O::kHttpStatus ? PMS_DL_ERR_HTTP
             : d.outcome == O::kTooLarge ? PMS_DL_ERR_TOO_LARGE
             : d.outcome == O::kDisk     ? PMS_DL_ERR_DISK
                                         : PMS_DL_ERR_NETWORK;
  return fail(code, "download of " + link + " failed: " + d.error);
}

}  // namespace

bool IsInstalling(const std::string& name) {
  NVX::TaskMgr mgr(KIVOPackageTasks::kTaskOwner);
  std::unique_ptr<NVX::Task> task(mgr.getTask(KIVOPackageTasks::kDownloadPrefix + name));
  if (!task || task->isFinished()) return false;
  Json::Value data = task->getProperty("data");
  return data.isObject() && data["pid"].isInt() && KLIBCProcAlive(data["pid"].asInt()) == 1;
}

Json::Value NewDownloadData(const std::string& taskId, const std::string& name, uint64_t size,
                            const std::string& link, const std::string& folder, bool quickInstall,
                            const PMSInstallChoices& choices) {
  Json::Value data(Json::objectValue);
  data["id"] = name;
  data["name"] = name;
  data["taskid"] = taskId;
  data["link"] = link;
  data["size"] = static_cast<Json::UInt64>(size);
  data["tmp_folder"] = folder;
  data["blqinst"] = quickInstall;
  if (choices.change == PMSOriginChange::kAllow) data["switch_origin"] = true;
  if (choices.without_data_copy) data["without_data_copy"] = true;
  data["installing"] = false;
  data["status"] = "downloading";
  return data;
}

bool InitDownload(NVX::Task* task, const std::string& name, uint64_t size, const std::string& link,
                  const std::string& folder, bool quickInstall, pid_t pid,
                  const PMSInstallChoices& choices) {
  if (!task) return false;
  Json::Value data =
      NewDownloadData(task->getTaskId(), name, size, link, folder, quickInstall, choices);
  data["pid"] = static_cast<int>(pid);
  return task->setFinishValue(false) && WriteTaskData(task, data, 0.0);
}

void RegisterCancel() {
  g_canceled = 0;
  struct sigaction action = {};
  action.sa_handler = OnTerm;
  sigemptyset(&action.sa_mask);
  sigaction(SIGTERM, &action, nullptr);
}

bool isCanceled() { return g_canceled != 0; }

bool DownloadPackage(NVX::Task* task, const std::string& user, const std::string& name,
                     const std::string& link, const std::string& checksum, bool quickInstall,
                     const std::string& folder, const std::string& language,
                     std::string& resultPath) {
  if (!task) return false;
  Json::Value data = task->getProperty("data");
  uint64_t size = data["size"].isUInt64() ? data["size"].asUInt64() : 0;
  if (link.empty() || !PMSIsServerUrl(link)) {
    PMSRemoveDownloadDir(folder);
    Fail(task, PMS_DL_ERR_REQUEST, "no http or https link for " + name);
    return false;
  }
  resultPath = folder + "/" + task->getTaskId();
  std::string sha256 = CatalogueSha256(name, link, language);
  TransferFailure failure;
  const bool transferred = Transfer(task, name, link, checksum, sha256, size, resultPath, &failure);
  if (!transferred || isCanceled()) {
    PMSRemoveDownloadDir(folder);
    if (!transferred) Fail(task, failure.code, failure.message);
    return false;
  }
  if (!TaskExists(task)) return false;
  if (!SetStatus(task, "downloaded", false, 1.0)) return false;
  // A quick install goes on in this task; a plain download is complete.
  return quickInstall || task->finish(true);
}

bool Install(NVX::Task* task, const std::string& user, const std::string& volume,
             const std::string& name, const std::string& folder, bool run,
             const std::string& wizardValues, bool typeFlag, const std::string& language) {
  if (!task) return false;
  const std::string path = folder + "/" + task->getTaskId();
  if (!SetStatus(task, PMSCheckPackage(name) ? "upgrading" : "installing", true)) {
    PMSRemoveDownloadDir(folder);
    return false;
  }
  // A file that a feed lists may be vouched for by that feed's keys; any
  // other download is checked against the appliance keyring alone.
  Json::Value data = task->getProperty("data");
  PMSInstallSource source;
  source.origin = PMSListingOrigin(name, data["link"].isString() ? data["link"].asString() : "",
                                   language, PMSInstalledOrigin(name));
  if (source.origin.kind == PMSOriginKind::kFeed)
    source.feed_keys = PMSFeedKeys(source.origin.feed);
  if (data["switch_origin"].isBool() && data["switch_origin"].asBool())
    source.choices.change = PMSOriginChange::kAllow;
  source.choices.without_data_copy =
      data["without_data_copy"].isBool() && data["without_data_copy"].asBool();
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details;
  bool ok = InstallPackageFileImpl(user, path, volume, 0, wizardValues, run, language, message,
                                   code, details, typeFlag, true, &source);
  PMSRemoveDownloadDir(folder);
  if (details["signature"].isString()) {
    DOWNLOAD_LOG("%s from %s: %s", name.c_str(), PMSSourceText(source.origin).c_str(),
                 details["signature"].asCString());
    if (!RecordSignature(task, source.origin, details["signature"].asString())) {
      DOWNLOAD_LOG("cannot record the signature of %s in its task", name.c_str());
    }
  }
  if (!ok) {
    DOWNLOAD_LOG("install of %s failed: %s [%d]", name.c_str(), message.c_str(),
                 static_cast<int>(code));
    Fail(task, PMS_DL_ERR_INSTALL, message.empty() ? "the install failed" : message,
         static_cast<int>(code),
         code == PKG_ERR_DEPENDENTS_RUNNING ? details["deppkg"].asString() : "");
    return false;
  }
  return SetStatus(task, "installed", false) && task->finish(true);
}

bool PMSRemoveDownloadDir(const std::string& folder) {
  // Only "<root>/<volume>/@tmp/download-<name>-XXXXXX" folders, nothing else.
  size_t slash = folder.rfind('/');
  if (folder.empty() || folder[0] != '/' || slash == std::string::npos ||
      folder.find("/../") != std::string::npos || folder.find("/./") != std::string::npos ||
      folder.compare(slash + 1, 9, "download-") != 0 || slash < 5 ||
      folder.compare(slash - 5, 5, "/@tmp") != 0 || folder.find('\0') != std::string::npos) {
    DOWNLOAD_LOG("refusing to remove %s: not a download folder", folder.c_str());
    return false;
  }
  const std::string root = KIVOSysRoot();
  if (!root.empty() && folder.compare(0, root.size() + 1, root + "/") != 0) return false;
  if (access(folder.c_str(), F_OK) != 0) return true;
  return KLIBCExec("/bin/rm", "-rf", folder.c_str(), nullptr, nullptr) == 0;
}

}  // namespace KIVOPackageServer
