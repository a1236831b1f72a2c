// The answer of one web API call. A handler answers once: SetSuccess,
// SetSuccessText or SetError (a later call replaces the earlier one, which is
// how a handler adds details to an error it has set). Raw-output handlers
// write their own HTTP answer on stdout and switch the JSON answer off with
// SetEnableOutput(false).
#pragma once

#include <string>
#include <vector>

#include <json/value.h>

class APIResponse {
 public:
  APIResponse() = default;
  APIResponse(const APIResponse&) = delete;
  APIResponse& operator=(const APIResponse&) = delete;

  void SetSuccess(Json::Value data = Json::Value());
  // A success whose data is already written: `json` must be exactly one JSON
  // value written compactly by KIVONewJsonWriter() (never text from
  // outside), for it is sent as it stands. A large answer assembled from
  // pieces of text written earlier is then not parsed and written again.
  void SetSuccessText(std::string json);
  void SetError(int code, Json::Value data = Json::Value());
  // The error code set so far; 0 when none (also after SetSuccess).
  int GetError() const { return error_code_; }
  void SetEnableOutput(bool enable) { output_enabled_ = enable; }

  // Host side.
  bool IsOutputEnabled() const { return output_enabled_; }
  bool IsAnswered() const { return answered_; }
  bool IsSuccess() const { return answered_ && error_code_ == 0; }
  // The data of SetSuccess or SetError; null after SetSuccessText.
  const Json::Value& GetData() const { return data_; }
  // Extra HTTP header lines ("Set-Cookie: ...") sent with the JSON answer.
  void AddHeader(const std::string& line) { headers_.push_back(line); }
  const std::vector<std::string>& Headers() const { return headers_; }
  // {"success": true, "data": D} or {"success": false, "error": {"code": N,
  // "errors": D}}, with "data"/"errors" left out when null. An unanswered
  // response gives the default error 100. The data of SetSuccessText is
  // parsed for it.
  Json::Value ToEnvelope() const;
  // The same as text written by KIVOWriteJson(), moving the data into it
  // (the response is spent afterwards): a large answer is not copied once
  // more on its way out, and text data is not parsed.
  std::string TakeEnvelopeText();

 private:
  bool answered_ = false;
  bool output_enabled_ = true;
  int error_code_ = 0;
  Json::Value data_;
  std::string data_text_;  // SetSuccessText's data; empty otherwise
  std::vector<std::string> headers_;
};
