#include "task_record.h"

#include <string>

#include "error_codes.h"
#include "klibc/process.h"
#include "log_line.h"

namespace KIVO_PACKAGE {

bool TaskProcessAlive(const Json::Value& data) {
  return data.isObject() && data["pid"].isInt() && KLIBCProcAlive(data["pid"].asInt()) == 1;
}

bool WorkerGone(NVX::Task& task, const Json::Value& data) {
  // The process first, then the task: a worker found dead cannot finish
  // its task any more, while one that finishes and exits between the two
  // questions asked the other way round would be taken for one that died.
  return data.isObject() && data["pid"].isInt() && !data["error"].isInt() &&
         !TaskProcessAlive(data) && !task.isFinished();
}

bool RecordWorkerGone(NVX::Task& task, Json::Value& data) {
  data["installing"] = false;
  data["error"] = kErrFailed;
  data["message"] = "the process that ran this job (pid " + std::to_string(data["pid"].asInt()) +
                    ") ended before the job did";
  return task.setProperty("data", data) && task.finish(false);
}

void DropTask(NVX::Task& task) {
  if (!task.remove()) PKG_LOG_ERR("Failed to remove task '%s'", task.getTaskId().c_str());
}

void EndStaleTask(NVX::Task& task, Json::Value& data) {
  const bool job = task.getTaskId().compare(0, sizeof(kDownloadPrefix) - 1, kDownloadPrefix) == 0 &&
                   data.isObject() && data["pid"].isInt() &&
                   !(data["blqinst"].isBool() && data["blqinst"].asBool());
  if (!job) {
    DropTask(task);
  } else if (WorkerGone(task, data) && !RecordWorkerGone(task, data)) {
    PKG_LOG_ERR("Failed to record the end of task '%s'", task.getTaskId().c_str());
  }
}

}  // namespace KIVO_PACKAGE
