#include "webapi/api_upload.h"

#include "webapi/api_request.h"

APIUpload::APIUpload(APIRequest* request) : request_(request) {}

int APIUpload::GetUploadParam(Json::Value& params) {
  UploadSource* source = request_->GetUploadSource();
  if (!source) return UPLOAD_FAILED;
  if (!params.isObject()) params = Json::Value(Json::objectValue);
  return source->ReadFields(params);
}

int APIUpload::GetUploadFile(Json::Value& params) {
  UploadSource* source = request_->GetUploadSource();
  if (!source) return UPLOAD_FAILED;
  if (!params.isObject()) params = Json::Value(Json::objectValue);
  return source->StoreFile(params);
}
