#include "webapi/api_response.h"

void APIResponse::SetSuccess(Json::Value data) {
  answered_ = true;
  error_code_ = 0;
  data_ = std::move(data);
}

void APIResponse::SetError(int code, Json::Value data) {
  answered_ = true;
  error_code_ = code;
  data_ = std::move(data);
}

namespace {

Json::Value Envelope(bool answered, int code, Json::Value data) {
  Json::Value out(Json::objectValue);
  if (answered && code == 0) {
    out["success"] = true;
    if (!data.isNull()) out["data"] = std::move(data);
    return out;
  }
  out["success"] = false;
  out["error"]["code"] = answered ? code : 100;
  if (answered && !data.isNull()) out["error"]["errors"] = std::move(data);
  return out;
}

}  // namespace

Json::Value APIResponse::ToEnvelope() const { return Envelope(answered_, error_code_, data_); }

Json::Value APIResponse::TakeEnvelope() {
  return Envelope(answered_, error_code_, std::move(data_));
}
