#include "webapi/api_response.h"

void APIResponse::SetSuccess(const Json::Value& data) {
  answered_ = true;
  error_code_ = 0;
  data_ = data;
}

void APIResponse::SetError(int code, const Json::Value& data) {
  answered_ = true;
  error_code_ = code;
  data_ = data;
}

Json::Value APIResponse::ToEnvelope() const {
  Json::Value out(Json::objectValue);
  if (answered_ && error_code_ == 0) {
    out["success"] = true;
    if (!data_.isNull()) out["data"] = data_;
    return out;
  }
  out["success"] = false;
  out["error"]["code"] = answered_ ? error_code_ : 100;
  if (answered_ && !data_.isNull()) out["error"]["errors"] = data_;
  return out;
}
