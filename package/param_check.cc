// The parameter checkers the host runs before each handler, and the check
// table that registers them.
//
// Every checker reads all of its parameters in a fixed order, then reports
// the first fault with code 120 and {"name", "reason"}: a missing required
// parameter ("required"), a wrong type or a non-string array element
// ("type"), then the value conditions in order ("condition").

#include <initializer_list>
#include <string>
#include <vector>

#include "request_values.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"
#include "webapi/api_table.h"
#include "webapi/api_validator.h"
#include "webapi/webapi_util.h"

namespace {

enum class Type { String, Int, Bool, Object, Array };

struct ParamSpec {
  const char* name;
  Type type;
  PARAM_NECESSITY necessity;
};

struct ReadParam {
  std::string name;
  Type type;
  bool set;
  bool invalid;
  Json::Value value;  // the typed value as JSON (string, int, bool, object, array)
};

template <typename T>
ReadParam MakeRead(const ParamSpec& spec, const APIParameter<T>& p) {
  return ReadParam{spec.name, spec.type, p.IsSet(), p.IsInvalid(), Json::Value(p.Get())};
}

ReadParam ReadOne(const APIRequest& request, const ParamSpec& spec) {
  switch (spec.type) {
    case Type::String:
      return MakeRead(spec, request.GetAndCheckString(spec.name, spec.necessity));
    case Type::Int:
      return MakeRead(spec, request.GetAndCheckInt(spec.name, spec.necessity));
    case Type::Bool:
      return MakeRead(spec, request.GetAndCheckBool(spec.name, spec.necessity));
    case Type::Object:
      return MakeRead(spec, request.GetAndCheckObject(spec.name, spec.necessity));
    case Type::Array:
      break;
  }
  return MakeRead(spec, request.GetAndCheckUnitArray(spec.name, spec.necessity));
}

// The parameters of one check, read in order, with the helpers that the
// conditions of the checkers need.
class Check {
 public:
  Check(APIRequest* request, APIResponse* response, std::initializer_list<ParamSpec> specs)
      : response_(response) {
    for (const ParamSpec& spec : specs) params_.push_back(ReadOne(*request, spec));
  }

  // Steps 2 and 3: the first invalid parameter, then the first array element
  // that is not a string. Refuses and answers false on a fault.
  bool TypesOk() {
    for (const ReadParam& p : params_) {
      if (p.invalid) return Refuse(p.name, p.set ? "type" : "required");
    }
    for (const ReadParam& p : params_) {
      if (p.type != Type::Array || !p.set) continue;
      for (const Json::Value& item : p.value) {
        if (!item.isString()) return Refuse(p.name, "type");
      }
    }
    return true;
  }

  const ReadParam& operator[](const std::string& name) const {
    for (const ReadParam& p : params_) {
      if (p.name == name) return p;
    }
    static const ReadParam kAbsent{"", Type::String, false, false, Json::Value()};
    return kAbsent;
  }

  // Writes the one parameter error and answers false.
  bool Refuse(const std::string& name, const char* reason) {
    Json::Value data(Json::objectValue);
    data["name"] = name;
    data["reason"] = reason;
    response_->SetError(120, data);
    return false;
  }

  // The array parameter holds at least one non-empty string.
  bool NotOnlyEmpty(const std::string& name) {
    return !InSet((*this)[name].value, "[\"\"]") || Refuse(name, "condition");
  }

  // The string parameter, when sent, is not empty.
  bool NotEmpty(const std::string& name) {
    const ReadParam& p = (*this)[name];
    return !p.set || !APIValidator::IsEqual(p.value.asString(), "") || Refuse(name, "condition");
  }

  // The parameter, when sent, is (each of its elements is) empty or a whole
  // package id: an id is checked as the string it is, before anything takes
  // a C string of it (a NUL or a path would make it name another package).
  bool Ids(const std::string& name) {
    const ReadParam& p = (*this)[name];
    return !p.set || KIVO_PACKAGE::AreIdsOrEmpty(p.value) || Refuse(name, "condition");
  }

  // The parameter, when sent, is (each of its elements is) one of `set_text`.
  bool OneOf(const std::string& name, const char* set_text) {
    const ReadParam& p = (*this)[name];
    return !p.set || InSet(p.value, set_text) || Refuse(name, "condition");
  }

 private:
  static bool InSet(const Json::Value& value, const char* set_text) {
    Json::Value set;
    WebAPIUtil::ParseJson(set_text, set);
    return APIValidator::IsBelong(value, set);
  }

  APIResponse* response_;
  std::vector<ReadParam> params_;
};

constexpr PARAM_NECESSITY kReq = PARAM_REQUIRED;
constexpr PARAM_NECESSITY kOpt = PARAM_OPTIONAL;

constexpr char kAdditionalKeys[] =
    "[\"autoupdate\",\"beta\",\"description\",\"description_enu\",\"distributor\","
    "\"distributor_url\",\"nvx_apps\",\"help_url\",\"install_reboot\",\"install_type\","
    "\"installed_info\",\"is_uninstall_pages\",\"maintainer\",\"maintainer_url\",\"url\","
    "\"report_beta_url\",\"silent_install\",\"silent_upgrade\",\"silent_uninstall\",\"startable\","
    "\"status\",\"support_center\",\"support_url\",\"uninstall_pages\",\"dependent_packages\","
    "\"start_dependent_services\",\"installing_progress\",\"ctl_uninstall\",\"log_path\"]";

bool AlwaysAccept(APIRequest*, APIResponse*) { return true; }

bool CheckStart(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}});
  return c.TypesOk() && c.NotOnlyEmpty("id") && c.Ids("id");
}

bool CheckStop(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}});
  return c.TypesOk() && c.Ids("id");
}

bool CheckUninstall(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}, {"extra_values", Type::String, kOpt}});
  return c.TypesOk() && c.NotOnlyEmpty("id") && c.Ids("id");
}

bool CheckSettingSet(APIRequest* req, APIResponse* resp) {
  Check c(req, resp,
          {{"packages", Type::Array, kOpt},
           {"update_channel", Type::String, kOpt},
           {"enable_email", Type::Bool, kOpt},
           {"enable_nvx", Type::Bool, kOpt},
           {"trust_level", Type::Int, kOpt},
           {"enable_autoupdate", Type::Bool, kOpt},
           {"autoupdateall", Type::Bool, kOpt},
           {"default_vol", Type::String, kOpt}});
  // "packages" may be the JSON text of the list: the handler parses it and
  // applies the id rule to the ids it holds.
  return c.TypesOk();
}

bool CheckVolumeSet(APIRequest* req, APIResponse* resp) {
  return Check(req, resp, {{"default_vol", Type::String, kOpt}}).TypesOk();
}

bool CheckIdArray(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}});
  return c.TypesOk() && c.Ids("id");
}

bool CheckThumb(APIRequest* req, APIResponse* resp) {
  return Check(
             req, resp,
             {{"name", Type::String, kOpt}, {"ver", Type::String, kOpt}, {"size", Type::Int, kOpt}})
      .TypesOk();
}

bool CheckThumbServer(APIRequest* req, APIResponse* resp) {
  return Check(req, resp,
               {{"name", Type::String, kOpt},
                {"ver", Type::String, kOpt},
                {"size", Type::Int, kOpt},
                {"bls", Type::Bool, kOpt},
                {"link", Type::String, kOpt}})
      .TypesOk();
}

bool CheckScreenshot(APIRequest* req, APIResponse* resp) {
  return Check(req, resp,
               {{"name", Type::String, kOpt},
                {"ver", Type::String, kOpt},
                {"index", Type::Int, kOpt},
                {"link", Type::String, kOpt},
                {"newlink", Type::String, kOpt}})
      .TypesOk();
}

bool CheckScreenshotServer(APIRequest* req, APIResponse* resp) {
  return Check(req, resp,
               {{"name", Type::String, kOpt},
                {"ver", Type::String, kOpt},
                {"index", Type::Int, kOpt},
                {"link", Type::String, kOpt}})
      .TypesOk();
}

// One required string that must not be empty.
template <const char* kName>
bool CheckRequiredNotEmpty(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{kName, Type::String, kReq}});
  return c.TypesOk() && c.NotEmpty(kName);
}

// One required string, types only.
template <const char* kName>
bool CheckRequiredString(APIRequest* req, APIResponse* resp) {
  return Check(req, resp, {{kName, Type::String, kReq}}).TypesOk();
}

constexpr char kName[] = "name";

constexpr char kList[] = "list";
constexpr char kTaskId[] = "task_id";
constexpr char kTaskid[] = "taskid";
constexpr char kPath[] = "path";
constexpr char kUploadKeyring[] = "upload_keyring";

bool CheckInstallationCheckV1(APIRequest* req, APIResponse* resp) {
  Check c(req, resp,
          {{"id", Type::Array, kOpt},
           {"depsers", Type::String, kOpt},
           {"deppkgs", Type::Object, kOpt},
           {"conflictpkgs", Type::Object, kOpt},
           {"install_type", Type::String, kOpt},
           {"size", Type::Int, kOpt},
           {"blCheckDep", Type::Bool, kOpt}});
  return c.TypesOk() && c.Ids("id");
}

bool CheckInstallationCheckV2(APIRequest* req, APIResponse* resp) {
  Check c(req, resp,
          {{"id", Type::Array, kOpt},
           {"depsers", Type::String, kOpt},
           {"deppkgs", Type::Object, kOpt},
           {"conflictpkgs", Type::Object, kOpt},
           {"install_type", Type::String, kOpt},
           {"size", Type::Int, kOpt},
           {"blCheckDep", Type::Bool, kOpt},
           {"ver", Type::String, kOpt}});
  return c.TypesOk() && c.Ids("id");
}

// An install names its source in one of three ways: a running upload task
// ("task_id"), a file already on the device ("path"), or a download ("name"
// with "url", which then needs "filesize").
bool CheckInstall(APIRequest* req, APIResponse* resp) {
  Check c(req, resp,
          {{"task_id", Type::String, kOpt},
           {"path", Type::String, kOpt},
           {"filesize", Type::Int, kOpt},
           {"volume_path", Type::String, kOpt},
           {"extra_values", Type::String, kOpt},
           {"type", Type::Int, kOpt},
           {"name", Type::String, kOpt},
           {"url", Type::String, kOpt},
           {"blqinst", Type::Bool, kOpt},
           {"checksum", Type::String, kOpt},
           {"installrunpackage", Type::Bool, kOpt},
           {"force", Type::Bool, kOpt},
           {"check_codesign", Type::Bool, kOpt},
           {"switch_origin", Type::Bool, kOpt}});
  if (!c.TypesOk()) return false;
  auto filled = [&c](const char* name) {
    const ReadParam& p = c[name];
    return p.set && !p.invalid && !APIValidator::IsEqual(p.value.asString(), "");
  };
  auto set_and_empty = [&c](const char* name) {
    return c[name].set && APIValidator::IsEqual(c[name].value.asString(), "");
  };
  if (!c["task_id"].set && !filled("name") && !filled("path")) {
    return c.Refuse("task_id", "condition");
  }
  if (!c["path"].set && !filled("name") && !filled("task_id")) {
    return c.Refuse("path", "condition");
  }
  if (filled("url") && filled("name") && !c["filesize"].set) {
    return c.Refuse("filesize", "condition");
  }
  if (set_and_empty("name")) return c.Refuse("name", "condition");
  if (set_and_empty("url")) return c.Refuse("url", "condition");
  return true;
}

bool CheckFeasibility(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"type", Type::String, kReq}, {"packages", Type::Array, kReq}});
  return c.TypesOk() && c.OneOf("type", "[\"install_check\",\"uninstall_check\",\"stop_check\"]") &&
         c.Ids("packages");
}

bool CheckList(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"additional", Type::Array, kOpt}});
  return c.TypesOk() && c.OneOf("additional", kAdditionalKeys);
}

bool CheckGet(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}, {"additional", Type::Array, kOpt}});
  return c.TypesOk() && c.NotOnlyEmpty("id") && c.Ids("id") &&
         c.OneOf("additional", kAdditionalKeys);
}

bool CheckServerList(APIRequest* req, APIResponse* resp) {
  return Check(req, resp, {{"blloadothers", Type::Bool, kOpt}, {"blforcereload", Type::Bool, kOpt}})
      .TypesOk();
}

constexpr char kControl[] = "KIVO.Core.Package.Control";
constexpr char kSetting[] = "KIVO.Core.Package.Setting";
constexpr char kVolume[] = "KIVO.Core.Package.Setting.Volume";
constexpr char kUpdate[] = "KIVO.Core.Package.Setting.Update";
constexpr char kFeed[] = "KIVO.Core.Package.Feed";
constexpr char kKeyring[] = "KIVO.Core.Package.Feed.Keyring";
constexpr char kInstallation[] = "KIVO.Core.Package.Installation";
constexpr char kPkg[] = "KIVO.Core.Package";

const WEBAPI_CHECK_ROW gCheckTable[] = {
    {kControl, 1, "start", CheckStart, nullptr, nullptr},
    {kControl, 1, "stop", CheckStop, nullptr, nullptr},
    {"KIVO.Core.Package.Uninstallation", 1, "uninstall", CheckUninstall, nullptr, nullptr},
    {kSetting, 1, "set", CheckSettingSet, nullptr, nullptr},
    {kSetting, 1, "get", AlwaysAccept, nullptr, nullptr},
    {kVolume, 1, "set", CheckVolumeSet, nullptr, nullptr},
    {kVolume, 1, "get", AlwaysAccept, nullptr, nullptr},
    {kUpdate, 1, "add", CheckIdArray, nullptr, nullptr},
    {kUpdate, 1, "delete", CheckIdArray, nullptr, nullptr},
    {"KIVO.Core.Package.Info", 1, "get", AlwaysAccept, nullptr, nullptr},
    {"KIVO.Core.Package.Thumb", 1, "get", CheckThumb, nullptr, nullptr},
    {"KIVO.Core.Package.Thumb.Server", 1, "get", CheckThumbServer, nullptr, nullptr},
    {"KIVO.Core.Package.Screenshot", 1, "get", CheckScreenshot, nullptr, nullptr},
    {"KIVO.Core.Package.Screenshot.Server", 1, "get", CheckScreenshotServer, nullptr, nullptr},
    {"KIVO.Core.Package.Log", 1, "get", CheckRequiredNotEmpty<kName>, nullptr, nullptr},
    {kFeed, 1, "add", CheckRequiredNotEmpty<kList>, nullptr, nullptr},
    {kFeed, 1, "set", CheckRequiredNotEmpty<kList>, nullptr, nullptr},
    {kFeed, 1, "list", AlwaysAccept, nullptr, nullptr},
    {kFeed, 1, "delete", CheckRequiredNotEmpty<kList>, nullptr, nullptr},
    {kKeyring, 1, "add", CheckRequiredString<kUploadKeyring>, nullptr, nullptr},
    {kKeyring, 1, "list", AlwaysAccept, nullptr, nullptr},
    {kKeyring, 1, "delete", CheckRequiredString<kList>, nullptr, nullptr},
    {kInstallation, 2, "check", CheckInstallationCheckV2, nullptr, nullptr},
    {kInstallation, 1, "check", CheckInstallationCheckV1, nullptr, nullptr},
    {kInstallation, 1, "status", CheckRequiredNotEmpty<kTaskId>, nullptr, nullptr},
    {kInstallation, 1, "install", CheckInstall, nullptr, nullptr},
    {kInstallation, 1, "upload", AlwaysAccept, nullptr, nullptr},
    {kInstallation, 1, "clean", CheckRequiredNotEmpty<kTaskId>, nullptr, nullptr},
    {kInstallation, 1, "cancel", CheckRequiredNotEmpty<kTaskid>, nullptr, nullptr},
    {kInstallation, 1, "delete", CheckRequiredNotEmpty<kPath>, nullptr, nullptr},
    {"KIVO.Core.Package.Installation.Download", 1, "check", CheckRequiredNotEmpty<kTaskid>, nullptr,
     nullptr},
    {"KIVO.Core.Package.FakeIFrame", 1, "get", AlwaysAccept, nullptr, nullptr},
    {kPkg, 1, "feasibility_check", CheckFeasibility, nullptr, nullptr},
    {kPkg, 1, "list", CheckList, nullptr, nullptr},
    {kPkg, 1, "get", CheckGet, nullptr, nullptr},
    {"KIVO.Core.Package.Server", 1, "list", CheckServerList, nullptr, nullptr},
    {"KIVO.Core.Package.Server", 1, "check", AlwaysAccept, nullptr, nullptr},
    {nullptr, 0, nullptr, nullptr, nullptr, nullptr},
};

}  // namespace

extern "C" __attribute__((visibility("default"))) const WEBAPI_CHECK_ROW* GetAPICheckTable() {
  return gCheckTable;
}
