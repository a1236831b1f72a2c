#include "download_record.h"

#include <string>

#include "activity/activity_log.h"
#include "error_codes.h"

namespace KIVO_PACKAGE {

namespace {

// What the task says of the worker's end: 0 and its last status
// ("installed", or "downloaded" for a download the wizard installs later),
// or the download's error number (docs/package-server.md) and its message,
// with the package tool's result when the install failed.
KivoActivity::Outcome TaskOutcome(NVX::Task* task) {
  const Json::Value data = task ? task->getProperty("data") : Json::Value();
  const Json::Value error = data.isObject() ? data["error"] : Json::Value();
  if (error.isObject() && error["code"].isInt()) {
    std::string words = error["message"].isString() ? error["message"].asString() : "";
    if (error["result"].isInt())
      words += " (package tool result " + std::to_string(error["result"].asInt()) + ")";
    return {error["code"].asInt(), words};
  }
  const std::string status =
      data.isObject() && data["status"].isString() ? data["status"].asString() : "";
  if (status == "installed" || status == "downloaded") return {0, status};
  // Neither an end nor an error: the task was dropped or could not be
  // read, which says nothing of success.
  return {kErrFailed, status.empty() ? "the download's task is gone" : "ended while " + status};
}

}  // namespace

void HandDownloadEntryTo(pid_t worker) {
  KivoActivity::ActivityLog log;
  static_cast<void>(log.HandOver(worker));
}

void EndDownloadEntry(NVX::Task* task, bool canceled) {
  KivoActivity::ActivityLog log;
  const KivoActivity::Outcome outcome =
      canceled ? KivoActivity::Outcome{kErrCancelled, "canceled"} : TaskOutcome(task);
  static_cast<void>(log.FinishHandedOver(outcome));
}

}  // namespace KIVO_PACKAGE
