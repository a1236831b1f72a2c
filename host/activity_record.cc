#include "host/activity_record.h"

#include <cstdlib>
#include <memory>
#include <unistd.h>
#include <vector>

#include "klibc/json_text.h"
#include "pkgtool/registry.h"
#include "taskmgr/task.h"
#include "taskmgr/task_names.h"
#include "webapi/api_codes.h"
#include "webapi/api_names.h"

namespace {

namespace api = WebAPIName;
using KivoActivity::Operation;

// The methods that change something: the ones the activity log records.
// Everything else the module serves only reads (lists, states, logs,
// images) or prepares a change that one of these makes (an upload becomes
// an install only through "install").
constexpr struct {
  const char* api;
  const char* method;
} kChangingMethods[] = {
    {api::kInstallation, "install"},
    {api::kInstallation, "cancel"},
    {api::kInstallation, "clean"},
    {api::kInstallation, "delete"},
    {api::kUninstallation, "uninstall"},
    {api::kControl, "start"},
    {api::kControl, "stop"},
    {api::kFeed, "add"},
    {api::kFeed, "set"},
    {api::kFeed, "delete"},
    {api::kKeyring, "add"},
    {api::kKeyring, "delete"},
    {api::kSetting, "set"},
    {api::kVolumeSetting, "set"},
    {api::kUpdateSetting, "add"},
    {api::kUpdateSetting, "delete"},
    {api::kUserSettings, "set"},
    {api::kAutoUpdate, "set"},
    {api::kAutoUpdate, "hold"},
    {api::kAutoUpdate, "release"},
    {api::kRevision, "rollback"},
    {api::kRevision, "drop"},
};

// The parameters whose values may be recorded: what a call names, never
// what proves who calls (passwords, tokens and session ids are not here and
// so never reach the log) nor what a package's wizard was told.
constexpr const char* kRecordedParams[] = {
    "id",
    "name",
    "version",
    "ver",
    "volume_path",
    "default_vol",
    "update_channel",
    "trust_level",
    "enable_autoupdate",
    "autoupdateall",
    "enable_email",
    "enable_nvx",
    "packages",
    "list",
    "switch_origin",
    "without_data_copy",
    "check_codesign",
    "force",
    "app",
    // The maintenance window and holds of automatic updates.
    "limited",
    "days",
    "start",
    "end",
    "random_delay_minutes",
    "until",
};

constexpr size_t kMaxValueBytes = 1024;
constexpr char kPackagePrefix[] = "KIVO.Core.Package.";

// "KIVO.Core.Package.Control" "start" -> "Control.start".
std::string OperationName(const std::string& api, const std::string& method) {
  const std::string prefix = kPackagePrefix;
  std::string short_api = api.compare(0, prefix.size(), prefix) == 0 ? api.substr(prefix.size())
                          : api == WebAPIName::kUserSettings         ? "UserSettings"
                                                                     : api;
  return short_api + "." + method;
}

// A parameter's value as recorded: credentials out of addresses, cut to a
// size that keeps one entry small.
Json::Value RecordedValue(const Json::Value& value) {
  std::string text =
      KivoActivity::WithoutCredentials(value.isString() ? value.asString() : KIVOWriteJson(value));
  if (text.size() > kMaxValueBytes) text = text.substr(0, kMaxValueBytes) + "...";
  if (value.isString()) return text;
  Json::Value parsed;
  return KIVOParseJson(text, &parsed) ? parsed : Json::Value(text);
}

void AddPackage(const Json::Value& v, std::vector<std::string>* packages) {
  if (v.isString() && PMSIsValidPackageId(v.asString())) packages->push_back(v.asString());
}

// The package ids a call names, each checked before it is recorded.
std::vector<std::string> PackagesOf(const APIRequest& request) {
  std::vector<std::string> packages;
  for (const char* name : {"id", "name", "packages"}) {
    Json::Value v = request.GetParam(name);
    Json::Value parsed;
    if (v.isString() && KIVOParseJson(v.asString(), &parsed) && parsed.isArray()) v = parsed;
    if (v.isArray()) {
      for (const Json::Value& e : v) AddPackage(e.isObject() ? e["id"] : e, &packages);
    } else {
      AddPackage(v, &packages);
    }
  }
  return packages;
}

// An install of an uploaded file names only the upload's task: the package
// and version it holds are in the task, and the version it replaces is in
// the registry.
void AddUploadedPackage(const APIRequest& request, Operation* op) {
  Json::Value task_id = request.GetParam("task_id");
  if (!task_id.isString() || task_id.asString().empty()) return;
  NVX::TaskMgr mgr(KIVOPackageTasks::kTaskOwner);
  std::unique_ptr<NVX::Task> task(mgr.getTask(task_id.asString()));
  Json::Value data = task ? task->getProperty("data") : Json::Value();
  if (!data.isObject() || !data["id"].isString() || !PMSIsValidPackageId(data["id"].asString()))
    return;
  const std::string id = data["id"].asString();
  op->target["id"] = id;
  if (data["version"].isString()) op->target["version"] = RecordedValue(data["version"]);
  KeyValueMap info;
  if (PackageRegistry::ReadInfo(id, &info)) op->target["from_version"] = info["version"];
  op->packages.push_back(id);
}

Operation OperationOf(const APIRequest& request) {
  Operation op;
  op.name = OperationName(request.GetAPIClass(), request.GetAPIMethod());
  for (const char* name : kRecordedParams) {
    if (request.HasParam(name)) op.target[name] = RecordedValue(request.GetParam(name));
  }
  // The settings a user stores are recorded by name only: an application
  // may keep anything there.
  Json::Value settings;
  if (request.GetParam("settings").isString() &&
      KIVOParseJson(request.GetParam("settings").asString(), &settings) && settings.isObject()) {
    for (const std::string& member : settings.getMemberNames())
      op.target["settings"].append(RecordedValue(member));
  }
  op.packages = PackagesOf(request);
  if (request.GetAPIClass() == api::kInstallation && request.GetAPIMethod() == "install")
    AddUploadedPackage(request, &op);
  return op;
}

// Names and addresses come from outside: recorded as data, and cut short.
std::string Bounded(const std::string& text) { return text.substr(0, 256); }

}  // namespace

bool IsRecordedMethod(const std::string& api, const std::string& method) {
  for (const auto& m : kChangingMethods) {
    if (api == m.api && method == m.method) return true;
  }
  return false;
}

std::string ClientAddress() {
  const char* address = getenv("REMOTE_ADDR");
  return address ? Bounded(address) : "";
}

KivoActivity::Outcome OutcomeOf(const APIResponse& response) {
  KivoActivity::Outcome outcome;
  if (response.IsSuccess()) {
    outcome.words = "success";
    return outcome;
  }
  outcome.code =
      response.IsAnswered() && response.GetError() != 0 ? response.GetError() : kErrUnknown;
  const Json::Value& data = response.GetData();
  for (const char* key : {"reason", "message"}) {
    if (data.isObject() && data[key].isString()) {
      outcome.words = data[key].asString();
      break;
    }
  }
  return outcome;
}

CallRecord::CallRecord(const APIRequest& request, const std::string& account) : pid_(getpid()) {
  if (!IsRecordedMethod(request.GetAPIClass(), request.GetAPIMethod())) return;
  KivoActivity::Actor actor{Bounded(account), KivoActivity::kOriginWeb, ClientAddress()};
  id_ = log_.Begin(actor, OperationOf(request));
}

CallRecord::~CallRecord() {
  if (id_ == 0 || getpid() != pid_) return;
  static_cast<void>(log_.Finish(id_, {kErrUnknown, "the method failed unexpectedly"}));
}

void CallRecord::Finish(const APIResponse& response) {
  if (id_ == 0 || getpid() != pid_) return;
  // A failure to record is in syslog already; the answer stands.
  static_cast<void>(log_.Finish(id_, OutcomeOf(response)));
  id_ = 0;
}

void RecordSignIn(const std::string& account, const APIResponse& response) {
  KivoActivity::Actor actor{Bounded(account), KivoActivity::kOriginWeb, ClientAddress()};
  Operation op;
  op.name = response.IsSuccess() ? "sign-in" : "sign-in failed";
  KivoActivity::ActivityLog log;
  static_cast<void>(log.Record(actor, op, OutcomeOf(response)));
}
