#include "webapi/api_response.h"

#include "klibc/json_text.h"

void APIResponse::SetSuccess(Json::Value data) {
  answered_ = true;
  error_code_ = 0;
  data_ = std::move(data);
  data_text_.clear();
}

void APIResponse::SetSuccessText(std::string json) {
  answered_ = true;
  error_code_ = 0;
  data_ = Json::Value();
  data_text_ = std::move(json);
}

void APIResponse::SetError(int code, Json::Value data) {
  answered_ = true;
  error_code_ = code;
  data_ = std::move(data);
  data_text_.clear();
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

Json::Value APIResponse::ToEnvelope() const {
  if (data_text_.empty()) return Envelope(answered_, error_code_, data_);
  Json::Value data;
  // The text is this process's own writer output; should it not parse, the
  // envelope says success without data rather than inventing any.
  (void)KIVOParseJson(data_text_, &data, JsonSyntax::Lenient);
  return Envelope(answered_, error_code_, std::move(data));
}

std::string APIResponse::TakeEnvelopeText() {
  // The writer puts an object's members in name order: "data" before
  // "success", as the envelope of SetSuccess comes out.
  if (!data_text_.empty()) return "{\"data\":" + std::move(data_text_) + ",\"success\":true}";
  return KIVOWriteJson(Envelope(answered_, error_code_, std::move(data_)));
}
