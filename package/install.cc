// Installation: the environment check, upload and inspection of a package
// file, the install task, progress and cancel, clean-up of an upload.

#include <cstdio>
#include <cstdlib>
#include <errno.h>
#include <memory>
#include <signal.h>
#include <unistd.h>

#include <json/writer.h>

#include "klibc/last_error.h"
#include "klibc/process.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgtool/pms.h"
#include "storage/storage_config.h"
#include "task_record.h"
#include "utils/package_utils.h"
#include "webapi/api_upload.h"
#include "webapi/webapi_util.h"

#include <string.h>

namespace KIVO_PACKAGE {

namespace {

// Code-signature outcomes of the package tool as API errors.
int CodesignError(int code) {
  switch (code) {
    case 288:
      return 4531;
    case 289:
      return 4532;
    case 290:
      return 4533;
    case 291:
      return 4534;
    case 292:
      return 4535;
    default:
      return 4501;
  }
}

bool IsCodesignCode(int code) { return code == 150 || (code >= 288 && code <= 292); }

std::string Firmware(int major, int minor, int build) {
  char text[32];
  snprintf(text, sizeof(text), "%d.%d-%04d", major, minor, build);
  return text;
}

std::string JsonText(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

void RemoveFile(const std::string& path) {
  if (!path.empty()) KLIBCExec("/bin/rm", "-rf", path.c_str(), nullptr, nullptr);
}

}  // namespace

bool PackageWebAPI::CheckPackageFileInfo(const char* path, PackageInfo& info) {
  Json::Value scratch;
  return CheckPackageFileInfo(path, info, false, scratch);
}

bool PackageWebAPI::CheckPackageFileInfo(const char* path, PackageInfo& info, bool strictCodesign,
                                         Json::Value& result) {
  if (!path) {
    response->SetError(4500, Json::Value());
    return false;
  }
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details(Json::objectValue);
  if (CheckPackageFileInfoImpl(request->GetUILanguage().c_str(), path, message, code, details,
                               info)) {
    return true;
  }
  if (IsCodesignCode(code)) {
    if (!strictCodesign) {
      result["codesign_error"] = CodesignError(code);
      return true;
    }
    response->SetError(CodesignError(code), Json::Value());
    return false;
  }
  Json::Value data(Json::objectValue);
  int major = 0, minor = 0, build = 0;
  switch (code) {
    case 260:
      data["services"] = details["serviceNoStarted"];
      return response->SetError(4525, data), false;
    case 261:
      return response->SetError(4522, Json::Value()), false;
    case 268:
      data["unstart_packages"] = details["unStartPkgList"].asString();
      data["uninstall_packages"] = details["packages"];
      return response->SetError(4526, data), false;
    case 277:
      return response->SetError(4529, Json::Value()), false;
    case 279:
      return response->SetError(4504, Json::Value()), false;
    case 281:
      return response->SetError(4528, Json::Value()), false;
    case 283:
      data["port"] = info.getAdminPort();
      return response->SetError(4527, data), false;
    case 284:
      data["packages"] = details["instPackageList"].asString();
      return response->SetError(4524, data), false;
    case 285:
    case 297:
      return response->SetError(4502, Json::Value()), false;
    case 296:
      return response->SetError(4505, Json::Value()), false;
    case 302:
      PMSGetOSMaxVer(info, major, minor, build);
      data["firmware"] = Firmware(major, minor, build);
      return response->SetError(4537, data), false;
    case 303:
      PMSGetOSMinVer(info, major, minor, build);
      data["firmware"] = Firmware(major, minor, build);
      return response->SetError(4538, data), false;
    default:
      return response->SetError(4501, Json::Value()), false;
  }
}

void PackageWebAPI::Upload() {
  Json::Value params(Json::objectValue);
  params["postParam"] = Json::Value(Json::objectValue);
  APIUpload upload(request);
  if (upload.GetUploadParam(params["postParam"]) != 1) {
    response->SetError(108, Json::Value());
    return;
  }
  int stored = upload.GetUploadFile(params["postParam"]);
  if (stored != 1) {
    int code = stored == -13                    ? 4502
               : stored == -12                  ? 4503
               : (stored == -3 || stored == -2) ? 4520
                                                : 108;
    response->SetError(code, Json::Value());
    return;
  }
  request->InitParam(params, false);
  const std::string file = request->GetParam("file_tmp", "").asString();
  Json::Value result(Json::objectValue);
  if (UploadAndDescribe(file, result)) {
    response->SetSuccess(result);
  } else {
    RemoveFile(file);  // a refused or failed upload leaves nothing behind
  }
}

bool PackageWebAPI::UploadAndDescribe(const std::string& file, Json::Value& result) {
  PackageInfo info;
  if (!pkgMgr.queryPackageFileInfoWithWizard(file, info, PKG_OP_NONE,
                                             request->GetUILanguage().c_str())) {
    response->SetError(4521, Json::Value());
    return false;
  }
  if (!CheckPackageFileInfo(file.c_str(), info, false, result)) return false;
  uint64_t mask = 0;
  if (request->HasParam("additional")) {
    Json::Value names = request->GetParam("additional");
    if (names.isString()) WebAPIUtil::ParseJson(names.asString(), names);
    mask = PackageUtils::ParseAdditional(names);
  }
  PackageUtils::DumpInfo(info, mask, result);
  if (!info.getLicense().empty()) PackageUtils::DumpLicense(info, result);
  if (!info.getUIFile().isNull() && !info.getUIFile().empty()) {
    PackageUtils::DumpUIFIle(info, result["install_pages"]);
  }
  if (mask) DumpStatusInfo(info, mask, result["additional"]);
  const std::string task_id = kUploadPrefix + NVX::TaskUtil::getUniqueID(kTaskOwner, 0);
  std::unique_ptr<NVX::Task> task(GetNewTask(kTaskOwner, task_id.c_str()));
  if (!task) {
    PKG_LOG_ERR("Failed to create task with task id '%s'", task_id.c_str());
    return false;
  }
  Json::Value data(Json::objectValue);
  data["id"] = info.getId();
  data["file_path"] = file;
  task->setProperty("data", data);
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
      response->SetError(4501, Json::Value());
      return;
    }
    path = data["file_path"].asString();
  }
  PackageInfo info;
  if (!pkgMgr.queryPackageFileInfo(path, info, PKG_OP_NONE, request->GetUILanguage().c_str())) {
    response->SetError(4521, Json::Value());
    return;
  }
  const std::string install_id = kDownloadPrefix + info.getId();
  std::unique_ptr<NVX::Task> task(GetNewTask(kTaskOwner, install_id.c_str()));
  if (!task) {
    PKG_LOG_ERR("Failed to create task with task id '%s'", install_id.c_str());
    return;
  }
  task->setFinishValue(false);
  task->beginUpdate();
  task->unsetProperty("progress");
  Json::Value data = task->getProperty("data");
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  data["id"] = info.getId();
  data["name"] = info.getDisplayName();
  data["pid"] = static_cast<int>(getpid());
  data["taskid"] = install_id;
  data["installing"] = true;
  data["status"] = PMSCheckPackage(info.getId()) ? "upgrading" : "installing";
  task->setProperty("data", data);
  task->endUpdate();
  Json::Value scratch;
  bool check_codesign = request->GetParam("check_codesign", true).asBool();
  bool ok = CheckPackageFileInfo(path.c_str(), info, check_codesign, scratch) &&
            InstallPackageFile(path.c_str());
  for (NVX::Task* t : {upload.get(), task.get()}) {
    if (!t) continue;
    if (ok) {
      t->remove();
    } else {
      t->finish(false);
    }
  }
  // An installed upload has served its purpose; without its task nobody
  // could clean it up any more.
  if (ok && upload) RemoveFile(path);
}

bool PackageWebAPI::InstallPackageFile(const char* path) {
  bool type_flag = std::atoi(request->GetParam("type", "0").asString().c_str()) != 0;
  bool force = request->GetParam("force", true).asBool();
  bool check_codesign = request->GetParam("check_codesign", true).asBool();
  std::string volume = request->GetParam("volume_path", "").asString();
  std::string extra = request->GetParam("extra_values", "").asString();
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details;
  bool ok = InstallPackageFileImpl(request->GetLoginUserName(), path, volume, 0, extra, type_flag,
                                   request->GetUILanguage(), message, code, details, force,
                                   check_codesign);
  Json::Value result(Json::objectValue);
  if (!message.empty()) result["message"] = message;
  result["worker_message"] =
      details["workerMessage"].isArray() ? details["workerMessage"] : Json::Value(Json::arrayValue);
  if (ok) {
    if (details["installReboot"].isBool() && details["installReboot"].asBool())
      result["reboot"] = true;
    response->SetSuccess(result);
    return true;
  }
  int error = 4501;
  switch (code) {
    case 255:
      error = 4545;
      break;
    case 259:
      error = 4548;
      result["current_version"] = details["curVersion"].asString();
      result["require_version"] = details["insVersion"].asString();
      break;
    case 261:
      error = 4521;
      break;
    case 264:
    case 265:
      error = 4528;
      break;
    case 267:
      error = 4546;
      result["current_version"] = details["curVersion"].asString();
      result["install_version"] = details["insVersion"].asString();
      break;
    case 268:
      error = 4547;
      result["packages"] = JsonText(details["deppkg"]);
      break;
    case 269:
      error = 4552;
      result["packages"] = JsonText(details["deppkg"]);
      break;
    case 270:
      error = 4544;
      break;
    case 274:
      error = 4549;
      break;
    case 275:
      error = 4530;
      break;
    case 276:
      error = 4540;
      break;
    case 277:
      error = 4541;
      break;
    case 279:
      error = 4520;
      break;
    case 285:
      error = 4503;
      break;
    case 297:
      error = 4502;
      break;
    case 304:
      error = 4550;
      break;
    case 305:
      error = 4542;
      break;
    default:
      break;
  }
  response->SetError(error, Json::Value());
  response->SetError(response->GetError(), result);
  return false;
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
  if (data.isNull()) {
    PKG_LOG_ERR("Failed to get json data");
    task->remove();
    response->SetError(4501, Json::Value());
    return;
  }
  if (data["installing"].isBool() && data["installing"].asBool()) {
    task->remove();
    response->SetError(4506, Json::Value());
    return;
  }
  KLIBCExec("/bin/rm", "-rf", data["tmp_folder"].asString().c_str(), nullptr, nullptr);
  int pid = data["pid"].isInt() ? data["pid"].asInt() : 0;
  if (pid < 1) {
    PKG_LOG_ERR("Invalid process id");
    task->remove();
    response->SetError(4501, Json::Value());
    return;
  }
  if (kill(pid, SIGTERM) != 0 && errno != ESRCH) {
    PKG_LOG_ERR("Failed to kill process, reason=%s(%d)", strerror(errno), errno);
    task->remove();
    response->SetError(4501, Json::Value());
    return;
  }
  task->remove();
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
    response->SetError(4501, Json::Value());
    return;
  }
  Json::Value data = task->getProperty("data");
  std::string file = data.isObject() ? data["file_path"].asString() : "";
  if (!data.isObject() || !data.isMember("file_path") || !data.isMember("id") || file.empty()) {
    response->SetError(4501, Json::Value());
  } else if (access(file.c_str(), F_OK) == 0) {
    RemoveFile(file);
  }
  task->remove();
}

}  // namespace KIVO_PACKAGE
