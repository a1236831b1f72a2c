// The parameter checkers (param_check.h): the parameters of each method
// with their types and conditions.

#include "param_check.h"

#include <string>
#include <vector>

#include "request_values.h"
#include "utils/package_utils.h"
#include "webapi/api_codes.h"
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
  Check(APIRequest* request, APIResponse* response, const std::vector<ParamSpec>& specs)
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
    response_->SetError(kErrParameter, data);
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

  // The array parameter, when sent, holds only names that "additional" may
  // hold.
  bool AdditionalNames(const std::string& name) {
    for (const Json::Value& item : (*this)[name].value) {
      if (!PackageUtils::IsAdditionalName(item.asString())) return Refuse(name, "condition");
    }
    return true;
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

// Checks the types of `specs` and nothing else.
bool TypesOnly(APIRequest* req, APIResponse* resp, const std::vector<ParamSpec>& specs) {
  return Check(req, resp, specs).TypesOk();
}

// One required string that must not be empty.
bool RequiredNotEmpty(APIRequest* req, APIResponse* resp, const char* name) {
  Check c(req, resp, {{name, Type::String, kReq}});
  return c.TypesOk() && c.NotEmpty(name);
}

// One required string, types only.
bool RequiredString(APIRequest* req, APIResponse* resp, const char* name) {
  return TypesOnly(req, resp, {{name, Type::String, kReq}});
}

// The types, then "id" holds at least one non-empty string, and only ids.
bool TypesAndSomeIds(Check& c) { return c.TypesOk() && c.NotOnlyEmpty("id") && c.Ids("id"); }

}  // namespace

namespace KIVO_PACKAGE {

bool AlwaysAccept(APIRequest*, APIResponse*) { return true; }

bool CheckList(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"additional", Type::Array, kOpt}});
  return c.TypesOk() && c.AdditionalNames("additional");
}

bool CheckGet(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}, {"additional", Type::Array, kOpt}});
  return TypesAndSomeIds(c) && c.AdditionalNames("additional");
}

bool CheckFeasibility(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"type", Type::String, kReq}, {"packages", Type::Array, kReq}});
  return c.TypesOk() && c.OneOf("type", "[\"install_check\",\"uninstall_check\",\"stop_check\"]") &&
         c.Ids("packages");
}

bool CheckLogName(APIRequest* req, APIResponse* resp) {
  return RequiredNotEmpty(req, resp, "name");
}

bool CheckInstallationCheck(APIRequest* req, APIResponse* resp) {
  std::vector<ParamSpec> specs = {{"id", Type::Array, kOpt},
                                  {"depsers", Type::String, kOpt},
                                  {"deppkgs", Type::Object, kOpt},
                                  {"conflictpkgs", Type::Object, kOpt},
                                  {"install_type", Type::String, kOpt},
                                  {"size", Type::Int, kOpt},
                                  {"blCheckDep", Type::Bool, kOpt}};
  if (req->GetAPIVersion() >= 2) specs.push_back({"ver", Type::String, kOpt});
  Check c(req, resp, specs);
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
           {"switch_origin", Type::Bool, kOpt},
           {"without_data_copy", Type::Bool, kOpt}});
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

bool CheckTaskId(APIRequest* req, APIResponse* resp) {
  return RequiredNotEmpty(req, resp, "task_id");
}

bool CheckTaskid(APIRequest* req, APIResponse* resp) {
  return RequiredNotEmpty(req, resp, "taskid");
}

bool CheckTmpPath(APIRequest* req, APIResponse* resp) {
  return RequiredNotEmpty(req, resp, "path");
}

bool CheckStart(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}});
  return TypesAndSomeIds(c);
}

bool CheckUninstall(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}, {"extra_values", Type::String, kOpt}});
  return TypesAndSomeIds(c);
}

bool CheckIds(APIRequest* req, APIResponse* resp) {
  Check c(req, resp, {{"id", Type::Array, kReq}});
  return c.TypesOk() && c.Ids("id");
}

bool CheckSettingSet(APIRequest* req, APIResponse* resp) {
  // "packages" may be the JSON text of the list: the handler parses it and
  // applies the id rule to the ids it holds.
  return TypesOnly(req, resp,
                   {{"packages", Type::Array, kOpt},
                    {"update_channel", Type::String, kOpt},
                    {"enable_email", Type::Bool, kOpt},
                    {"enable_nvx", Type::Bool, kOpt},
                    {"trust_level", Type::Int, kOpt},
                    {"enable_autoupdate", Type::Bool, kOpt},
                    {"autoupdateall", Type::Bool, kOpt},
                    {"default_vol", Type::String, kOpt}});
}

bool CheckVolumeSet(APIRequest* req, APIResponse* resp) {
  return TypesOnly(req, resp, {{"default_vol", Type::String, kOpt}});
}

bool CheckFeedList(APIRequest* req, APIResponse* resp) {
  return RequiredNotEmpty(req, resp, "list");
}

bool CheckKeyringAdd(APIRequest* req, APIResponse* resp) {
  return RequiredString(req, resp, "upload_keyring");
}

bool CheckKeyringDelete(APIRequest* req, APIResponse* resp) {
  return RequiredString(req, resp, "list");
}

bool CheckServerList(APIRequest* req, APIResponse* resp) {
  return TypesOnly(req, resp,
                   {{"blloadothers", Type::Bool, kOpt}, {"blforcereload", Type::Bool, kOpt}});
}

bool CheckThumb(APIRequest* req, APIResponse* resp) {
  return TypesOnly(
      req, resp,
      {{"name", Type::String, kOpt}, {"ver", Type::String, kOpt}, {"size", Type::Int, kOpt}});
}

bool CheckThumbServer(APIRequest* req, APIResponse* resp) {
  return TypesOnly(req, resp,
                   {{"name", Type::String, kOpt},
                    {"ver", Type::String, kOpt},
                    {"size", Type::Int, kOpt},
                    {"bls", Type::Bool, kOpt},
                    {"link", Type::String, kOpt}});
}

bool CheckScreenshot(APIRequest* req, APIResponse* resp) {
  return TypesOnly(req, resp,
                   {{"name", Type::String, kOpt},
                    {"ver", Type::String, kOpt},
                    {"index", Type::Int, kOpt},
                    {"link", Type::String, kOpt},
                    {"newlink", Type::String, kOpt}});
}

bool CheckScreenshotServer(APIRequest* req, APIResponse* resp) {
  return TypesOnly(req, resp,
                   {{"name", Type::String, kOpt},
                    {"ver", Type::String, kOpt},
                    {"index", Type::Int, kOpt},
                    {"link", Type::String, kOpt}});
}

}  // namespace KIVO_PACKAGE
