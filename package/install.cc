// The web API's side of installing (KIVO.Core.Package.Installation; the
// package tool's own install is platform/pkgtool/install.cc): the
// environment check, upload and inspection of a package file, the install
// task, progress and cancel, clean-up of an upload.

#include <cstdio>
#include <cstdlib>
#include <errno.h>
#include <memory>
#include <signal.h>
#include <unistd.h>

#include "error_codes.h"
#include "klibc/json_text.h"
#include "klibc/last_error.h"
#include "klibc/process.h"
#include "log_line.h"
#include "package_webapi.h"
#include "permissions.h"
#include "pkgtool/pms.h"
#include "pkgtool/result_codes.h"
#include "remove_tree.h"
#include "request_values.h"
#include "task_record.h"
#include "utils/package_utils.h"
#include "webapi/api_upload.h"
#include "webapi/webapi_util.h"

#include <string.h>

namespace KIVO_PACKAGE {

namespace {

// Code-signature outcomes of the package tool. A member that does not match
// the signed MANIFEST is a bad signature like any other.
constexpr ToolCodeMapping kCodesignErrors[] = {
    {PKG_ERR_SIGNATURE_UNCHECKABLE, kErrFailed}, {PKG_ERR_NO_SIGNATURE, kErrNoSignature},
    {PKG_ERR_BAD_SIGNATURE, kErrBadSignature},   {PKG_ERR_UNKNOWN_SIGNER, kErrUnknownSigner},
    {PKG_ERR_EXPIRED_KEY, kErrExpiredKey},       {PKG_ERR_REVOKED_KEY, kErrRevokedKey},
};

// The package file's check against this appliance (upload, and the install
// before it runs).
constexpr ToolCodeMapping kCheckErrors[] = {
    {PKG_ERR_SERVICE_NOT_RUNNING, kErrServiceNotRunning},
    {PKG_ERR_NOT_PACKAGE_FILE, kErrBadPackageFile},
    {PKG_ERR_DEPENDENCY, kErrDependencyMissing},
    {PKG_ERR_HOSTILE_MEMBER, kErrUnsafeMember},
    {PKG_ERR_NO_SPACE, kErrNoRoomOnVolume},
    {PKG_ERR_ARCH, kErrNotSupported},
    {PKG_ERR_PORT_IN_USE, kErrPortInUse},
    {PKG_ERR_CONFLICT, kErrConflict},
    {PKG_ERR_NO_TMP, kErrNoVolume},
    {PKG_ERR_VOLUME_CRASHED, kErrVolumeUnusable},
    {PKG_ERR_NO_VOLUME, kErrNoVolume},
    {PKG_ERR_OS_TOO_NEW, kErrOsTooNew},
    {PKG_ERR_OS_TOO_OLD, kErrOsTooOld},
    {PKG_ERR_ROOT_NOT_TRUSTED, kErrRootNotTrusted},
    {PKG_ERR_LIMIT_ABOVE_BOUND, kErrLimitAboveBound},
};

// The install itself.
constexpr ToolCodeMapping kInstallErrors[] = {
    {PKG_ERR_NOT_INSTALLED, kErrInstallNotInstalled},
    {PKG_ERR_VERSION_LIMIT, kErrVersionLimit},
    {PKG_ERR_NOT_PACKAGE_FILE, kErrNotPackageFile},
    {PKG_ERR_NOT_SUPPORTED, kErrNotSupported},
    {PKG_ERR_BUILTIN, kErrNotSupported},
    {PKG_ERR_NOT_NEWER, kErrNotNewer},
    {PKG_ERR_DEPENDENCY, kErrInstallDependency},
    {PKG_ERR_DEPENDENTS_RUNNING, kErrDependentsRunning},
    {PKG_ERR_BAD_WIZARD_VALUES, kErrBadWizardValues},
    {PKG_ERR_SCRIPT_FAILED, kErrScriptFailed},
    {PKG_ERR_BUSY, kErrBusy},
    {PKG_ERR_EXTRACT, kErrExtractFailed},
    {PKG_ERR_HOSTILE_MEMBER, kErrUnsafePayload},
    {PKG_ERR_INTERNAL, kErrFailed},
    {PKG_ERR_NO_SPACE, kErrNoSpace},
    {PKG_ERR_NO_TMP, kErrNoTmpDir},
    {PKG_ERR_NO_VOLUME, kErrNoVolume},
    {PKG_ERR_CANCELLED, kErrCancelled},
    {PKG_ERR_UPGRADE_ROLLED_BACK, kErrUpgradeRolledBack},
    {PKG_ERR_OTHER_ORIGIN, kErrOtherOrigin},
    {PKG_ERR_ROOT_NOT_TRUSTED, kErrRootNotTrusted},
    {PKG_ERR_LIMIT_ABOVE_BOUND, kErrLimitAboveBound},
    {PKG_ERR_NO_ROOM_FOR_DATA_COPY, kErrNoRoomForDataCopy},
    {PKG_ERR_DATA_NOT_COPYABLE, kErrDataNotCopyable},
    {PKG_ERR_NO_ACCOUNT_ID, kErrNoAccountId},
    {PKG_ERR_ACCOUNT_FILES, kErrAccountFiles},
};

bool IsCodesignCode(int code) {
  for (const ToolCodeMapping& row : kCodesignErrors) {
    if (row.tool == code) return true;
  }
  return false;
}

std::string Firmware(int major, int minor, int build) {
  char text[32];
  snprintf(text, sizeof(text), "%d.%d-%04d", major, minor, build);
  return text;
}

// Error details that carry the package tool's own words.
Json::Value WithMessage(Json::Value data, const std::string& message) {
  if (message.empty()) return data;
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  data["message"] = message;
  return data;
}

// The install task's job: the request process that installs while it lives.
bool InstallInUse(const Json::Value& data) { return TaskProcessAlive(data); }

}  // namespace

bool PackageWebAPI::CheckPackageFileInfo(const char* path, PackageInfo& info) {
  Json::Value scratch;
  return CheckPackageFileInfo(path, info, false, scratch);
}

bool PackageWebAPI::CheckPackageFileInfo(const char* path, PackageInfo& info, bool strictCodesign,
                                         Json::Value& result) {
  if (!path) {
    response->SetError(kErrBadParameter, Json::Value());
    return false;
  }
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details(Json::objectValue);
  if (CheckPackageFileInfoImpl(request->GetUILanguage().c_str(), path, message, code, details,
                               info)) {
    result["permissions"] = DescribePermissions(info, details);
    return true;
  }
  if (IsCodesignCode(code)) {
    if (!strictCodesign) {
      result["permissions"] = DescribePermissions(info, details);
      result["codesign_error"] = MapToolCode(kCodesignErrors, code);
      if (!message.empty()) result["codesign_message"] = message;
      return true;
    }
    response->SetError(MapToolCode(kCodesignErrors, code), WithMessage(Json::Value(), message));
    return false;
  }
  response->SetError(MapToolCode(kCheckErrors, code),
                     WithMessage(CheckErrorDetails(code, info, details), message));
  return false;
}

Json::Value PackageWebAPI::CheckErrorDetails(int code, const PackageInfo& info,
                                             const Json::Value& details) {
  Json::Value data(Json::objectValue);
  int major = 0, minor = 0, build = 0;
  switch (code) {
    case PKG_ERR_SERVICE_NOT_RUNNING:
      data["services"] = details["serviceNoStarted"];
      break;
    case PKG_ERR_DEPENDENCY:
      data["unstart_packages"] = details["unStartPkgList"].asString();
      data["uninstall_packages"] = details["packages"];
      break;
    case PKG_ERR_PORT_IN_USE:
      data["port"] = info.getAdminPort();
      break;
    case PKG_ERR_CONFLICT:
      data["packages"] = details["instPackageList"].asString();
      break;
    case PKG_ERR_OS_TOO_NEW:
      PMSGetOSMaxVer(info, major, minor, build);
      data["firmware"] = Firmware(major, minor, build);
      break;
    case PKG_ERR_OS_TOO_OLD:
      PMSGetOSMinVer(info, major, minor, build);
      data["firmware"] = Firmware(major, minor, build);
      break;
    default:
      return Json::Value();
  }
  return data;
}

bool PackageWebAPI::ReadPackageFile(const std::string& path, PackageInfo& info, bool wizard) {
  const char* language = request->GetUILanguage().c_str();
  bool read = wizard ? pkgMgr.queryPackageFileInfoWithWizard(path, info, PKG_OP_NONE, language)
                     : pkgMgr.queryPackageFileInfo(path, info, PKG_OP_NONE, language);
  const int code = pkgMgr.getResult();
  // A member that does not match MANIFEST is a bad signature: the package
  // tool still reads the record when INFO keeps its rules, and the check
  // that follows judges it like a payload changed after signing (a warning
  // at upload and at a download's check, refused by the install). Only a
  // file with nothing to describe is refused here.
  if ((read || IsCodesignCode(code)) && IsPackageId(info.getId())) return true;
  Json::Value data = WithMessage(
      Json::Value(), read ? "the package id in INFO is not valid" : PMSResultText(code));
  response->SetError(
      !read && IsCodesignCode(code) ? MapToolCode(kCodesignErrors, code) : kErrNotPackageFile,
      data);
  return false;
}

void PackageWebAPI::Upload() {
  Json::Value params(Json::objectValue);
  params["postParam"] = Json::Value(Json::objectValue);
  APIUpload upload(request);
  if (upload.GetUploadParam(params["postParam"]) != UPLOAD_OK) {
    response->SetError(kErrUploadNotStored, Json::Value());
    return;
  }
  int stored = upload.GetUploadFile(params["postParam"]);
  if (stored != UPLOAD_OK) {
    response->SetError(UploadError(stored), Json::Value());
    return;
  }
  request->InitParam(params, false);
  const std::string file = request->GetParam("file_tmp", "").asString();
  Json::Value result(Json::objectValue);
  if (UploadAndDescribe(file, result)) {
    response->SetSuccess(result);
  } else {
    RemoveTree(file);  // a refused or failed upload leaves nothing behind
  }
}

bool PackageWebAPI::UploadAndDescribe(const std::string& file, Json::Value& result) {
  PackageInfo info;
  if (!IsCleanText(file)) {
    response->SetError(kErrUploadNotStored, Json::Value());
    return false;
  }
  if (!ReadPackageFile(file, info, true)) return false;
  if (!CheckPackageFileInfo(file.c_str(), info, false, result)) return false;
  uint64_t mask = 0;
  if (request->HasParam("additional")) {
    Json::Value names = request->GetParam("additional");
    if (names.isString()) WebAPIUtil::ParseJson(names.asString(), names);
    mask = PackageUtils::ParseAdditional(names);
  }
  PackageUtils::DumpInfo(info, mask, result);
  if (!info.getLicense().empty()) PackageUtils::DumpLicense(info, result);
  // Plain text the page shows before a manual upgrade (as text, never markup).
  if (!info.getReleaseNotes().empty()) result["changelog"] = info.getReleaseNotes();
  if (!info.getUIFile().isNull() && !info.getUIFile().empty()) {
    PackageUtils::DumpUIFIle(info, result["install_pages"]);
  }
  if (mask) DumpStatusInfo(info, mask, result["additional"]);
  return RegisterUpload(file, info.getId(), result);
}

// The upload task that lets "install" find the file. A task id is answered
// only once the task holds the file's data.
bool PackageWebAPI::RegisterUpload(const std::string& file, const std::string& id,
                                   Json::Value& result) {
  std::string unique;
  if (!NVX::TaskUtil::getUniqueID(kTaskOwner, 0, &unique)) {
    PKG_LOG_ERR("No random bytes for an upload task id");
    response->SetError(kErrFailed, WithMessage(Json::Value(), "the upload task cannot be named"));
    return false;
  }
  const std::string task_id = kUploadPrefix + unique;
  std::unique_ptr<NVX::Task> task(GetNewTask(kTaskOwner, task_id.c_str()));
  Json::Value data(Json::objectValue);
  data["id"] = id;
  data["file_path"] = file;
  if (!task || !task->setProperty("data", data)) {
    PKG_LOG_ERR("Failed to create task with task id '%s'", task_id.c_str());
    if (task) DropTask(*task);
    response->SetError(kErrFailed, WithMessage(Json::Value(), "the upload task cannot be written"));
    return false;
  }
  result["task_id"] = task_id;
  return true;
}

void PackageWebAPI::Install() {
  std::string task_id = request->GetParam("task_id", "").asString();
  std::string path = request->GetParam("path", "").asString();
  NVX::TaskMgr mgr(kTaskOwner);
  if (request->HasParam("name")) {
    Download();
    return;
  }
  std::unique_ptr<NVX::Task> upload;
  if (path.empty()) {
    upload.reset(GetTaskWithTaskMgr(mgr, task_id));
    Json::Value data = upload ? upload->getProperty("data") : Json::Value();
    if (!data.isObject() || !data.isMember("file_path") || !data.isMember("id") ||
        data["file_path"].asString().empty()) {
      response->SetError(kErrFailed, Json::Value());
      return;
    }
    path = data["file_path"].asString();
  }
  PackageInfo info;
  if (!IsCleanText(path)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  if (!ReadPackageFile(path, info, false)) return;
  std::unique_ptr<NVX::Task> task(ClaimInstallTask(mgr, info));
  if (!task) return;
  Json::Value scratch;
  bool check_codesign = request->GetParam("check_codesign", true).asBool();
  bool ok = CheckPackageFileInfo(path.c_str(), info, check_codesign, scratch) &&
            InstallPackageFile(path.c_str());
  if (ok) {
    if (upload) DropTask(*upload);
    DropTask(*task);
    // An installed upload has served its purpose; without its task nobody
    // could clean it up any more.
    if (upload) RemoveTree(path);
  } else {
    if (upload && !upload->finish(false))
      PKG_LOG_ERR("Failed to finish task '%s'", task_id.c_str());
    RecordFailure(*task);
  }
}

// The install task "@KIVOPKG_DOWNLOAD_" + id, taken for this process in one
// step. While another install of the package holds it, it is left as it is
// and the answer is busy. Null with the answer set on failure.
NVX::Task* PackageWebAPI::ClaimInstallTask(NVX::TaskMgr& mgr, const PackageInfo& info) {
  const std::string install_id = kDownloadPrefix + info.getId();
  Json::Value data(Json::objectValue);
  data["id"] = info.getId();
  data["name"] = info.getDisplayName();
  data["pid"] = static_cast<int>(getpid());
  data["taskid"] = install_id;
  data["installing"] = true;
  data["status"] = PMSCheckPackage(info.getId()) ? "upgrading" : "installing";
  NVX::Task* task = nullptr;
  switch (mgr.claimTask(install_id, data, InstallInUse, &task)) {
    case NVX::TaskMgr::Claim::kClaimed:
      return task;
    case NVX::TaskMgr::Claim::kBusy:
      response->SetError(kErrBusy, WithMessage(Json::Value(), "another install of " + info.getId() +
                                                                  " is under way"));
      return nullptr;
    case NVX::TaskMgr::Claim::kFailed:
      break;
  }
  PKG_LOG_ERR("Failed to create task with task id '%s'", install_id.c_str());
  response->SetError(kErrFailed, WithMessage(Json::Value(), "the install task cannot be written"));
  return nullptr;
}

// A failed install leaves its task finished with false for the status call.
// Its data stays as the install wrote it ("installing" true): the answer to
// "install" says why it failed, and a finished task whose data still says
// installing is one that ended without success.
void PackageWebAPI::RecordFailure(NVX::Task& task) {
  if (!task.finish(false)) {
    PKG_LOG_ERR("Failed to record the end of task '%s'", task.getTaskId().c_str());
  }
}

bool PackageWebAPI::InstallPackageFile(const char* path) {
  bool type_flag = std::atoi(request->GetParam("type", "0").asString().c_str()) != 0;
  bool force = request->GetParam("force", true).asBool();
  bool check_codesign = request->GetParam("check_codesign", true).asBool();
  std::string volume = request->GetParam("volume_path", "").asString();
  std::string extra = request->GetParam("extra_values", "").asString();
  if (!path || !HasNoNul(volume)) {
    response->SetError(kErrBadParameter, Json::Value());
    return false;
  }
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details;
  // An uploaded file, or one on the device: a file's origin.
  PMSInstallSource source;
  source.choices = InstallChoicesParam();
  bool ok = InstallPackageFileImpl(request->GetLoginUserName(), path, volume, 0, extra, type_flag,
                                   request->GetUILanguage(), message, code, details, force,
                                   check_codesign, &source);
  Json::Value result(Json::objectValue);
  if (!message.empty()) result["message"] = message;
  result["worker_message"] =
      details["workerMessage"].isArray() ? details["workerMessage"] : Json::Value(Json::arrayValue);
  // Which key signed the file and who vouched for it: the package tool's
  // finding, never one of the package's own messages.
  if (details["signature"].isString()) result["signature"] = details["signature"];
  if (ok) {
    if (details["installReboot"].isBool() && details["installReboot"].asBool())
      result["reboot"] = true;
    response->SetSuccess(result);
    return true;
  }
  switch (code) {
    case PKG_ERR_VERSION_LIMIT:
      result["current_version"] = details["curVersion"].asString();
      result["require_version"] = details["insVersion"].asString();
      break;
    case PKG_ERR_NOT_NEWER:
      result["current_version"] = details["curVersion"].asString();
      result["install_version"] = details["insVersion"].asString();
      break;
    case PKG_ERR_DEPENDENCY:
    case PKG_ERR_DEPENDENTS_RUNNING:
      result["packages"] = KIVOWriteJson(details["deppkg"]);
      break;
    default:
      break;
  }
  // The install checks the signature under the trust level itself (also
  // when the caller confirmed it unchecked): its refusal answers as the
  // signature's outcome does everywhere.
  const int signature_error = MapToolCode(kCodesignErrors, code);
  response->SetError(
      signature_error != kErrFailed ? signature_error : MapToolCode(kInstallErrors, code), result);
  return false;
}

PMSInstallChoices PackageWebAPI::InstallChoicesParam() const {
  const auto flag = [this](const char* name) {
    Json::Value v = request->GetParam(name, false);
    return v.isBool() && v.asBool();
  };
  PMSInstallChoices choices;
  if (flag("switch_origin")) choices.change = PMSOriginChange::kAllow;
  choices.without_data_copy = flag("without_data_copy");
  return choices;
}

void PackageWebAPI::CancelProgress() {
  NVX::TaskMgr mgr(kTaskOwner);
  std::unique_ptr<NVX::Task> task(
      GetTaskWithTaskMgr(mgr, request->GetParam("taskid", "").asString()));
  if (!task) {
    response->SetSuccess();
    return;
  }
  // Whatever happens below, the task is dropped before the answer.
  Json::Value data = task->getProperty("data");
  DropTask(*task);
  if (data.isNull()) {
    PKG_LOG_ERR("Failed to get json data");
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  // An install is never cut off, and its "pid" is the request process that
  // ran it (or ran it once): never a process to signal.
  if (data["installing"].isBool() && data["installing"].asBool()) {
    response->SetError(kErrInstallRunning, Json::Value());
    return;
  }
  if (data["tmp_folder"].isString()) RemoveTree(data["tmp_folder"].asString());
  int pid = data["pid"].isInt() ? data["pid"].asInt() : 0;
  if (pid < 1) {
    PKG_LOG_ERR("Invalid process id");
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  if (kill(pid, SIGTERM) != 0 && errno != ESRCH) {
    PKG_LOG_ERR("Failed to kill process, reason=%s(%d)", strerror(errno), errno);
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  for (int i = 0; i < 10 && KLIBCProcAlive(pid) == 1; ++i) sleep(1);
  if (KLIBCProcAlive(pid) == 1) kill(pid, SIGKILL);
  response->SetSuccess();
}

void PackageWebAPI::CleanTmp() {
  const std::string task_id = request->GetParam("task_id", "").asString();
  NVX::TaskMgr mgr(kTaskOwner);
  pid_t child = KLIBCProcFork();
  if (child > 0) {
    response->SetSuccess();
    return;
  }
  // The child (or this process, when there is no child) does the work; a
  // child's answer is never sent.
  std::unique_ptr<NVX::Task> task(GetTaskWithTaskMgr(mgr, task_id));
  if (!task) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value data = task->getProperty("data");
  std::string file = data.isObject() ? data["file_path"].asString() : "";
  if (!data.isObject() || !data.isMember("file_path") || !data.isMember("id") || file.empty()) {
    response->SetError(kErrFailed, Json::Value());
  } else if (IsCleanText(file) && access(file.c_str(), F_OK) == 0) {
    RemoveTree(file);
  }
  DropTask(*task);
}

}  // namespace KIVO_PACKAGE
