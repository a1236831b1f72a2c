#include "webapi/api_request.h"

#include <climits>

#include "webapi/webapi_util.h"

namespace {

// The text a client would have sent for a value that arrived already decoded.
std::string RawTextOf(const Json::Value& value) {
  if (value.isString()) return value.asString();
  if (value.isNull()) return "";
  if (value.isBool() || value.isIntegral()) return value.asString();
  return value.toStyledString();
}

}  // namespace

const APIRequest::Param* APIRequest::Find(const std::string& name) const {
  auto it = params_.find(name);
  return it == params_.end() ? nullptr : &it->second;
}

// Shared shape of the checked readers: `convert` turns a present parameter
// into the typed value and answers false on a type fault.
template <typename T, typename Convert>
APIParameter<T> APIRequest::Read(const std::string& name, PARAM_NECESSITY necessity,
                                 APIParamValidator validator, Convert convert) const {
  const Param* p = Find(name);
  if (!p) return APIParameter<T>(false, necessity == PARAM_REQUIRED, T{});
  T value{};
  bool ok = convert(*p, &value);
  if (ok && validator && !validator(p->value)) ok = false;
  return APIParameter<T>(true, !ok, ok ? value : T{});
}

APIParameter<std::string> APIRequest::GetAndCheckString(const std::string& name,
                                                        PARAM_NECESSITY necessity,
                                                        APIParamValidator validator) const {
  return Read<std::string>(name, necessity, validator, [](const Param& p, std::string* out) {
    if (p.value.isObject() || p.value.isArray()) return false;
    *out = p.value.isString() ? p.value.asString() : p.raw;
    return true;
  });
}

APIParameter<int> APIRequest::GetAndCheckInt(const std::string& name, PARAM_NECESSITY necessity,
                                             APIParamValidator validator) const {
  return Read<int>(name, necessity, validator, [](const Param& p, int* out) {
    if (!p.value.isIntegral() || p.value.isBool() || !p.value.isInt()) return false;
    *out = p.value.asInt();
    return true;
  });
}

APIParameter<bool> APIRequest::GetAndCheckBool(const std::string& name, PARAM_NECESSITY necessity,
                                               APIParamValidator validator) const {
  return Read<bool>(name, necessity, validator, [](const Param& p, bool* out) {
    if (!p.value.isBool()) return false;
    *out = p.value.asBool();
    return true;
  });
}

APIParameter<Json::Value> APIRequest::GetAndCheckObject(const std::string& name,
                                                        PARAM_NECESSITY necessity,
                                                        APIParamValidator validator) const {
  return Read<Json::Value>(name, necessity, validator, [](const Param& p, Json::Value* out) {
    if (!p.value.isObject()) return false;
    *out = p.value;
    return true;
  });
}

APIParameter<Json::Value> APIRequest::GetAndCheckUnitArray(const std::string& name,
                                                           PARAM_NECESSITY necessity,
                                                           APIParamValidator validator) const {
  return Read<Json::Value>(name, necessity, validator, [](const Param& p, Json::Value* out) {
    if (p.value.isArray()) {
      *out = p.value;
      return true;
    }
    if (!p.value.isString()) return false;
    *out = Json::Value(Json::arrayValue);
    out->append(p.value);
    return true;
  });
}

Json::Value APIRequest::GetParam(const std::string& name, const Json::Value& def) const {
  const Param* p = Find(name);
  return p ? p->value : def;
}

bool APIRequest::HasParam(const std::string& name) const { return Find(name) != nullptr; }

void APIRequest::AddRawParam(const std::string& name, const std::string& raw) {
  params_[name] = Param{raw, WebAPIUtil::DecodeParamValue(raw)};
}

void APIRequest::InitParam(const Json::Value& params, bool merge) {
  if (!merge) params_.clear();
  if (!params.isObject()) return;
  for (const std::string& name : params.getMemberNames()) {
    const Json::Value& value = params[name];
    if (name == "postParam" && value.isObject()) {
      for (const std::string& field : value.getMemberNames()) {
        params_[field] = Param{RawTextOf(value[field]), value[field]};
      }
      continue;
    }
    params_[name] = Param{RawTextOf(value), value};
  }
}

void APIRequest::SetAPI(const std::string& api, const std::string& method, int version) {
  api_ = api;
  method_ = method;
  version_ = version;
}
