// Posted files: a multipart request's fields and its file part, read by the
// host as the body streams in. The host gives the request an UploadSource;
// a handler reads it through APIUpload.
#pragma once

#include <json/value.h>

class APIRequest;

// Results of the upload calls besides 1 (success).
enum APIUploadResult {
  UPLOAD_OK = 1,
  UPLOAD_FAILED = -1,       // the body is malformed or could not be read
  UPLOAD_NO_SPACE = -3,     // the volume ran out of room
  UPLOAD_TOO_LARGE = -2,    // no volume has room for a file that size
  UPLOAD_NO_TMP_DIR = -12,  // no temporary folder can be made
  UPLOAD_NO_VOLUME = -13,   // no volume can take uploads
  UPLOAD_NO_FILE = -4,      // the body holds no file part
};

class UploadSource {
 public:
  virtual ~UploadSource() = default;
  // Adds the fields posted before the file part to the object `fields`.
  virtual int ReadFields(Json::Value& fields) = 0;
  // Streams the file part into a new temporary file and adds "file_tmp" (its
  // path), "file_name" (the name the client gave) and the fields after the
  // file to `fields`. A failure leaves no file behind.
  virtual int StoreFile(Json::Value& fields) = 0;
};

class APIUpload {
 public:
  explicit APIUpload(APIRequest* request);
  APIUpload(const APIUpload&) = delete;
  APIUpload& operator=(const APIUpload&) = delete;

  // The posted fields (1), or UPLOAD_FAILED when the request has no
  // multipart body.
  int GetUploadParam(Json::Value& params);
  // Stores the posted file (see UploadSource::StoreFile).
  int GetUploadFile(Json::Value& params);

 private:
  APIRequest* request_;
};
