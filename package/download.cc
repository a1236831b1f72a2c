// The status of a running install or download.

#include <memory>
#include <unistd.h>

#include "klibc/process.h"
#include "package_webapi.h"
#include "pkgtool/pms.h"
#include "task_record.h"

namespace KIVO_PACKAGE {

namespace {

// A download's progress of exactly 1.0 counts only once its file is there.
double DownloadProgress(NVX::Task& task, const Json::Value& data) {
  double progress = task.getDoubleProperty("progress", 0.0);
  if (progress == 1.0) {
    std::string file = data["tmp_folder"].asString() + "/" + task.getTaskId();
    return access(file.c_str(), F_OK) == 0 ? 1.0 : 0.0;
  }
  return progress < 0 ? 0.0 : progress;
}

}  // namespace

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
  task->waitForDataReady("data", 60);
  Json::Value data = task->getProperty("data");
  if (data.isNull()) {
    response->SetError(4501, Json::Value());
    return;
  }
  data["finished"] = task->isFinished();
  if (data["installing"].isBool() && data["installing"].asBool()) {
    double progress = data.isMember("id") ? PMSGetProgress(data["id"].asString()) : -1.0;
    if (progress != -1.0) data["progress"] = progress;
  } else {
    data["progress"] = DownloadProgress(*task, data);
  }
  if (data["blqinst"].isBool() && data["blqinst"].asBool()) {
    bool gone =
        !task->isFinished() && data["pid"].isInt() && KLIBCProcAlive(data["pid"].asInt()) != 1;
    if (task->isFinished() || gone) {
      data["finished"] = true;
      task->remove();
    }
  } else if (task->getDoubleProperty("progress", 0.0) < 0) {
    // A failed download: drop its task and its folder.
    task->remove();
    if (data.isMember("tmp_folder")) {
      KLIBCExec("/bin/rm", "-rf", data["tmp_folder"].asString().c_str(), nullptr, nullptr);
    }
  }
  response->SetSuccess(data);
}

}  // namespace KIVO_PACKAGE
