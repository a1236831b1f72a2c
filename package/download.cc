// The web API's side of downloads from a package server (the transfer
// itself is platform/pkgserver/download.cc): the download task and its
// worker, the check of a downloaded file, and the status of a running
// install or download.

#include "pkgserver/download.h"

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <unistd.h>

#include "download_record.h"
#include "error_codes.h"
#include "klibc/last_error.h"
#include "klibc/process.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgserver/server_record.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "remove_tree.h"
#include "request_values.h"
#include "task_record.h"

#include <poll.h>

namespace KIVO_PACKAGE {

double PackageWebAPI::DownloadTaskProgress(NVX::Task& task, const Json::Value& data) {
  double progress = task.getDoubleProperty("progress", 0.0);
  if (progress == 1.0) {
    std::string file = data["tmp_folder"].asString() + "/" + task.getTaskId();
    return access(file.c_str(), F_OK) == 0 ? 1.0 : 0.0;
  }
  return progress < 0 ? 0.0 : progress;
}

void PackageWebAPI::ReadProgress() {
  NVX::TaskMgr mgr(kTaskOwner);
  std::unique_ptr<NVX::Task> task(
      GetTaskWithTaskMgr(mgr, request->GetParam("task_id", "").asString()));
  if (!task) {
    Json::Value done(Json::objectValue);
    done["finished"] = true;
    response->SetSuccess(done);
    return;
  }
  // Whether the task is finished is read before its data: a job writes its
  // last data and then finishes, so data read after a finish was seen is
  // the job's last, while data read first could be older than a finish
  // read after it, and the answer would end the job with the data of its
  // middle ("downloading", finished).
  const bool finished = task->isFinished();
  task->waitForDataReady("data", 60);
  Json::Value data = task->getProperty("data");
  if (data.isNull()) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  const bool queued = data["blqinst"].isBool() && data["blqinst"].asBool();
  // When the task cannot be written, this answer still says the job failed
  // and the next reader tries again.
  if (!queued && WorkerGone(*task, data) && !RecordWorkerGone(*task, data)) {
    PKG_LOG_ERR("Failed to record the end of task '%s'", task->getTaskId().c_str());
  }
  data["finished"] = finished || data["error"].isInt();
  if (data["installing"].isBool() && data["installing"].asBool()) {
    double progress = data.isMember("id") ? PMSGetProgress(data["id"].asString()) : -1.0;
    if (progress != -1.0) data["progress"] = progress;
  } else {
    data["progress"] = DownloadTaskProgress(*task, data);
  }
  // A server download's worker puts its outcome on record from the task
  // once it has finished it (download_record.h): until the worker is gone
  // the task is neither reported finished nor dropped.
  if (finished && data["link"].isString() && data["pid"].isInt() &&
      KLIBCProcAlive(data["pid"].asInt()) == 1) {
    data["finished"] = false;
    response->SetSuccess(data);
    return;
  }
  if (queued) {
    // Dead, and then still unfinished: the worker ended without finishing.
    const bool gone = !finished && data["pid"].isInt() &&
                      KLIBCProcAlive(data["pid"].asInt()) != 1 && !task->isFinished();
    if (finished || gone) {
      data["finished"] = true;
      DropTask(*task);
    }
  } else if (task->getDoubleProperty("progress", 0.0) < 0) {
    // A failed download: drop its task and its folder. Its worker wrote the
    // failure with this progress and finishes the task after, maybe after
    // the reads above: this answer, the last there will be, carries the
    // failure and ends the job.
    Json::Value failed = task->getProperty("data");
    if (failed.isObject()) {
      failed["progress"] = 0.0;
      data = failed;
    }
    data["finished"] = true;
    DropTask(*task);
    if (data["tmp_folder"].isString()) RemoveTree(data["tmp_folder"].asString());
  }
  response->SetSuccess(data);
}

namespace {

// The platform's last-error number for a worker that could not be forked.
constexpr int kForkFailed = 0x9700;

// A flag parameter: true, "true" or a nonzero number; `def` when absent.
bool FlagParamOr(APIRequest* request, const char* name, bool def) {
  if (!request->HasParam(name)) return def;
  Json::Value v = request->GetParam(name, def);
  if (v.isBool()) return v.asBool();
  if (v.isIntegral()) return v.asInt64() != 0;
  return v.isString() && (v.asString() == "true" || v.asString() == "1");
}

// A size parameter sent as a number or as decimal text; 0 when it is neither.
uint64_t SizeParam(const Json::Value& v) {
  if (v.isUInt64()) return v.asUInt64();
  if (!v.isString()) return 0;
  long long size = std::strtoll(v.asString().c_str(), nullptr, 10);
  return size > 0 ? static_cast<uint64_t>(size) : 0;
}

// The answers for the platform's last error after a failed download start.
constexpr ToolCodeMapping kDownloadStartErrors[] = {
    {KLIBC_ERR_NO_SPACE, kErrNoSpace},        {KLIBC_ERR_LOCK, kErrBusy},
    {KLIBC_ERR_VOLUME_CRASHED, kErrNoVolume}, {KLIBC_ERR_VOLUME_NOT_FOUND, kErrNoVolume},
    {KLIBC_ERR_NO_TMP_DIR, kErrNoTmpDir},
};

// A worker that outlives the request lets go of the request's pipes, or the
// web server would keep the request open until the download ends.
void DetachFromRequest() {
  int null = open("/dev/null", O_RDWR | O_CLOEXEC);
  for (int fd = 0; fd < 3; ++fd) dup2(null, fd);
  if (null > 2) close(null);
}

// In the worker: waits (up to a minute) until the request says through
// `release` (the reading end of a pipe) that it recorded the worker in the
// task. True then; false when the request ended without doing so, or the
// download was cancelled meanwhile (SIGTERM ends the wait at once).
//
// The worker does not read the task store to learn it: a connection opened
// in a forked child while the parent writes could go on seeing the task
// without its worker, and the worker then waited out the minute, deaf to a
// cancel.
bool WaitToBeReleased(int release) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(1);
  for (;;) {
    if (KIVOPackageServer::isCanceled()) return false;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    struct pollfd p = {release, POLLIN, 0};
    const int ready = poll(&p, 1, static_cast<int>(left.count()));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;
    char byte = 0;
    const ssize_t n = read(release, &byte, 1);
    if (n < 0 && errno == EINTR) continue;
    return n == 1;
  }
}

// Removes the download folder of the task `task_id` that a new download is
// about to replace (the task itself is replaced with it).
void RemoveReplacedDownload(NVX::TaskMgr& mgr, const std::string& task_id) {
  std::unique_ptr<NVX::Task> earlier(mgr.getTask(task_id));
  const Json::Value data = earlier ? earlier->getProperty("data") : Json::Value();
  if (data.isObject() && data["tmp_folder"].isString() &&
      !KIVOPackageServer::PMSRemoveDownloadDir(data["tmp_folder"].asString())) {
    PKG_LOG_ERR("Failed to remove the replaced download folder of '%s'", task_id.c_str());
  }
}

}  // namespace

bool PackageWebAPI::DeterminePackageInfo(DownloadRequest& d) const {
  d.name = request->GetParam("name", "").asString();
  d.quick_install = FlagParamOr(request, "blqinst", false);
  d.install_and_run = FlagParamOr(request, "installrunpackage", false);
  d.volume = request->GetParam("volume_path", "").asString();
  d.wizard_values = request->GetParam("customuivalues", "").asString();
  d.choices = InstallChoicesParam();
  if (!PMSIsValidPackageId(d.name)) {
    Json::Value details(Json::objectValue);
    details["name"] = "name";
    details["reason"] = "not a package id";
    response->SetError(kErrBadParameter, details);
    return false;
  }
  if (request->HasParam("url")) {
    d.link = request->GetParam("url", "").asString();
    d.checksum = request->GetParam("checksum", "").asString();
    d.size = SizeParam(request->GetParam("filesize", "0"));
    d.type_flag = request->GetParam("type", 0).isIntegral() && request->GetParam("type", 0).asInt();
    return true;
  }
  PackageInfo installed;
  PackageManager manager;
  if (manager.getInstallPackageInfo(d.name, installed) &&
      (manager.getPkgRoughStatus(d.name) & PackageManager::kRoughBroken) != 0 &&
      PMSThirdPartyCheckLimit(d.name, installed.getVersion()) == 0 &&
      KIVOPackageServer::PMSGetPkgFromServer(request->GetUILanguage(), installed)) {
    d.link = installed.get("link");
    d.checksum = installed.get("checksum");
    d.size = SizeParam(Json::Value(installed.get("size")));
    d.type_flag = std::atoi(installed.get("type").c_str()) != 0;
    return true;
  }
  Json::Value record;
  if (!KIVOPackageServer::GetPackageInfoFromServer(
          d.name, record, FlagParamOr(request, "is_kivo", true), request->GetUILanguage())) {
    PKG_LOG_ERR("Failed to get package info for '%s' from server", d.name.c_str());
    response->SetError(kErrFailed, Json::Value());
    return false;
  }
  d.link = record["link"].isString() ? record["link"].asString() : "";
  d.checksum = record["md5"].isString() ? record["md5"].asString() : "";
  d.size = record["size"].isUInt64() ? record["size"].asUInt64() : 0;
  d.type_flag = record["type"].isInt() && record["type"].asInt() != 0;
  return true;
}

pid_t PackageWebAPI::ForkProcess(NVX::Task* task, Json::Value& result, const std::string& name,
                                 uint64_t size, const std::string& link, const std::string& folder,
                                 bool quickInstall, const PMSInstallChoices& choices) {
  if (name.empty() || !task || link.empty() || folder.empty()) return -1;
  int release[2] = {-1, -1};
  const bool piped = pipe2(release, O_CLOEXEC) == 0;
  const pid_t pid = piped ? KLIBCProcFork() : -1;
  if (pid < 0) {
    if (piped) {
      close(release[0]);
      close(release[1]);
    }
    DropTask(*task);
    KLIBCErrSetEx(kForkFailed, __FILE__, __LINE__);
    return -1;
  }
  if (pid == 0) {
    close(release[1]);
    DetachFromRequest();
    KIVOPackageServer::RegisterCancel();
    // The task has its data from the start; the worker begins once the
    // request has recorded it as the task's worker, so that its reports are
    // never overwritten by that record.
    const bool released = WaitToBeReleased(release[0]);
    close(release[0]);
    if (released) return 0;
    // Cancelled before it began (the cancel removed the task and its
    // folder), or never recorded: nothing to do but say how it ended.
    EndDownloadEntry(task, KIVOPackageServer::isCanceled());
    _exit(0);
  }
  close(release[0]);
  // Before the worker is released: its end is the install's outcome.
  HandDownloadEntryTo(pid);
  if (KIVOPackageServer::InitDownload(task, name, size, link, folder, quickInstall, pid, choices)) {
    result["taskid"] = task->getTaskId();
    result["progress"] = "0.00001";  // a string, as clients have always received it
    // A worker that is never released ends on its own.
    static_cast<void>(write(release[1], "1", 1));
  }
  close(release[1]);
  return pid;
}

bool PackageWebAPI::DownloadAndInstallPackage(const DownloadRequest& d, Json::Value& result) {
  NVX::TaskMgr mgr(kTaskOwner);
  const std::string task_id = kDownloadPrefix + d.name;
  if (KIVOPackageServer::IsInstalling(d.name) && mgr.hasTask(task_id)) {
    std::unique_ptr<NVX::Task> running(GetTaskWithTaskMgr(mgr, task_id));
    Json::Value data = running ? running->getProperty("data") : Json::Value();
    if (running && !data.isNull()) {
      result["data"] = data;
      result["progress"] = running->getDoubleProperty("progress", 0);
      return true;
    }
    if (running) DropTask(*running);
  }
  // A download this one replaces (a finished one, its file kept for the
  // wizard) goes with its file here, so that the install after the wizard
  // is one request: a page that goes away between two requests would leave
  // the file dropped and nothing installed.
  RemoveReplacedDownload(mgr, task_id);
  std::string folder;
  if (!PMSCreateDownloadTmpDir(d.volume, d.name, static_cast<int64_t>(d.size), folder))
    return false;
  // The task takes the place of the earlier one with its data in one step:
  // a listing between the two would find neither download, and a page
  // reloaded right after asking for the install would offer it again.
  NVX::Task* claimed = nullptr;
  const Json::Value first = KIVOPackageServer::NewDownloadData(task_id, d.name, d.size, d.link,
                                                               folder, d.quick_install, d.choices);
  const auto never_held = [](const Json::Value&) { return false; };
  if (mgr.claimTask(task_id, first, never_held, &claimed) != NVX::TaskMgr::Claim::kClaimed) {
    claimed = nullptr;
  }
  std::unique_ptr<NVX::Task> task(claimed);
  if (!task) {
    PKG_LOG_ERR("Failed to create task with task id '%s'", task_id.c_str());
    KIVOPackageServer::PMSRemoveDownloadDir(folder);
    return false;
  }
  pid_t pid =
      ForkProcess(task.get(), result, d.name, d.size, d.link, folder, d.quick_install, d.choices);
  if (pid < 0) {
    KIVOPackageServer::PMSRemoveDownloadDir(folder);
    return false;
  }
  if (pid > 0) return true;
  // The worker: it never answers the request.
  setsid();
  std::string path;
  const std::string user = request->GetLoginUserName(), language = request->GetUILanguage();
  bool ok = KIVOPackageServer::DownloadPackage(task.get(), user, d.name, d.link, d.checksum,
                                               d.quick_install, folder, language, path);
  if (ok && !KIVOPackageServer::isCanceled() && d.quick_install) {
    (void)KIVOPackageServer::Install(task.get(), user, d.volume, d.name, folder, d.install_and_run,
                                     d.wizard_values, d.type_flag, language);
  }
  EndDownloadEntry(task.get(), KIVOPackageServer::isCanceled());
  task.reset();
  _exit(0);
}

void PackageWebAPI::Download() {
  DownloadRequest d;
  if (!DeterminePackageInfo(d)) return;
  Json::Value result(Json::objectValue);
  KLIBCErrClear();
  if (DownloadAndInstallPackage(d, result)) {
    response->SetSuccess(result);
    return;
  }
  response->SetError(MapToolCode(kDownloadStartErrors, KLIBCErrGet()), Json::Value());
}

void PackageWebAPI::CheckDownloadPkgInfo() {
  NVX::TaskMgr mgr(kTaskOwner);
  std::unique_ptr<NVX::Task> task(
      GetTaskWithTaskMgr(mgr, request->GetParam("taskid", Json::Value()).asString()));
  if (!task) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value data = task->getProperty("data");
  if (data.isNull()) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  const std::string path = (data["tmp_folder"].isString() ? data["tmp_folder"].asString() : "") +
                           "/" + task->getTaskId();
  PackageInfo info;
  Json::Value result(Json::objectValue);
  bool ok = false;
  if (access(path.c_str(), F_OK) != 0) {
    response->SetError(kErrFailed, Json::Value());
  } else if (!ReadPackageFile(path, info, true)) {
    // Read like an uploaded file: a member changed after signing is the
    // check's bad signature, not an unreadable file.
  } else {
    ok = CheckPackageFileInfo(path.c_str(), info, false, result);
  }
  if (!ok) {
    // A download that cannot be installed is of no use: it goes, with its task.
    if (data["tmp_folder"].isString())
      KIVOPackageServer::PMSRemoveDownloadDir(data["tmp_folder"].asString());
    DropTask(*task);
    return;
  }
  DumpPkgInfo(path, info, result);
  response->SetSuccess(result);
}

}  // namespace KIVO_PACKAGE
