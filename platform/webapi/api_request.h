// One web API call as the module sees it: its parameters, who made it, and
// which API, method and version it is for. The host fills it in before it
// runs the checker and the handler; it lives for the request.
#pragma once

#include <map>
#include <string>

#include <json/value.h>

#include "webapi/api_parameter.h"

class UploadSource;

class APIRequest {
 public:
  APIRequest() = default;
  APIRequest(const APIRequest&) = delete;
  APIRequest& operator=(const APIRequest&) = delete;

  // Checked readers. Each returns the parameter with IsSet() (sent at all)
  // and IsInvalid() (required and missing, or sent with the wrong type, or
  // failing `validator`):
  //  - string: a quoted JSON string's content, or the text as sent for any
  //    other scalar (ver=1.10 is "1.10", name=5 is "5"); objects and arrays
  //    are a type fault;
  //  - int: only a JSON integer that fits in an int;
  //  - bool: only true or false;
  //  - object, array: only that JSON type;
  //  - unit array: an array, or a single string taken as the array of that
  //    one string (id=pkg reads as ["pkg"]); numbers, booleans, null and
  //    objects are a type fault. Elements are not checked here.
  APIParameter<std::string> GetAndCheckString(const std::string& name, PARAM_NECESSITY necessity,
                                              APIParamValidator validator = nullptr) const;
  APIParameter<int> GetAndCheckInt(const std::string& name, PARAM_NECESSITY necessity,
                                   APIParamValidator validator = nullptr) const;
  APIParameter<bool> GetAndCheckBool(const std::string& name, PARAM_NECESSITY necessity,
                                     APIParamValidator validator = nullptr) const;
  APIParameter<Json::Value> GetAndCheckObject(const std::string& name, PARAM_NECESSITY necessity,
                                              APIParamValidator validator = nullptr) const;
  APIParameter<Json::Value> GetAndCheckUnitArray(const std::string& name, PARAM_NECESSITY necessity,
                                                 APIParamValidator validator = nullptr) const;

  // Plain reading: the decoded value, or `def` when the parameter is absent.
  Json::Value GetParam(const std::string& name, const Json::Value& def = Json::Value()) const;
  bool HasParam(const std::string& name) const;

  // Host side: adds a parameter from its text as sent (decoded as the web API
  // decodes every value). A later value for the same name replaces the earlier.
  void AddRawParam(const std::string& name, const std::string& raw);

  // Takes the members of the object `params` as the request's parameters,
  // replacing the current ones (or, with `merge`, adding to them). Posted form
  // fields gathered under "postParam" become parameters of their own, so that
  // a handler reads them like any other parameter.
  void InitParam(const Json::Value& params, bool merge);

  const std::string& GetLoginUserName() const { return user_; }
  // The interface language ("enu", "ger", ...), used to pick package texts.
  const std::string& GetUILanguage() const { return language_; }
  // The API name of the call ("KIVO.Core.Package" or "KIVO.Package", ...).
  const std::string& GetAPIClass() const { return api_; }
  const std::string& GetAPIMethod() const { return method_; }
  int GetAPIVersion() const { return version_; }

  void SetAPI(const std::string& api, const std::string& method, int version);
  void SetLoginUserName(const std::string& user) { user_ = user; }
  // The posted body of a multipart request (null otherwise); owned by the host.
  UploadSource* GetUploadSource() const { return upload_; }
  void SetUploadSource(UploadSource* upload) { upload_ = upload; }
  void SetUILanguage(const std::string& language) { language_ = language; }

 private:
  struct Param {
    std::string raw;    // the text as sent
    Json::Value value;  // the decoded value
  };
  const Param* Find(const std::string& name) const;
  template <typename T, typename Convert>
  APIParameter<T> Read(const std::string& name, PARAM_NECESSITY necessity,
                       APIParamValidator validator, Convert convert) const;

  std::map<std::string, Param> params_;
  std::string api_;
  std::string method_;
  int version_ = 0;
  std::string user_;
  std::string language_ = "enu";
  UploadSource* upload_ = nullptr;
};
