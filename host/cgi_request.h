// Reading one CGI request: the environment the web server sets and the body
// on stdin, turned into the web API's parameters.
#pragma once

#include <cstdint>
#include <string>

#include "host/request_deadline.h"
#include "webapi/url_encoded.h"

struct CgiRequest {
  std::string method;           // REQUEST_METHOD
  std::string cookie;           // HTTP_COOKIE
  std::string token;            // HTTP_X_KIVO_TOKEN
  std::string accept_language;  // HTTP_ACCEPT_LANGUAGE
  FormFields query;             // fields of the query string, in order
  FormFields body;              // fields of an urlencoded body, in order
  std::string boundary;         // multipart/form-data: its boundary (the body is left unread)
  uint64_t content_length = 0;
  // When the whole body must have arrived (BodyDeadlineMs); a multipart
  // reader reads the rest of it against the same deadline.
  int64_t body_deadline_ms = 0;
};

// Limits that keep a hostile request from costing memory or time.
constexpr size_t kMaxBodyBytes = 4 << 20;
constexpr size_t kMaxFields = 1000;

// Reads the request from the environment and `body_fd`. Returns false with a
// short reason for the client when the request is malformed: an invalid
// percent-escape, an unsupported method or content type, an urlencoded body
// larger than kMaxBodyBytes, shorter than its CONTENT_LENGTH or not whole by
// its deadline (from `clock`), a multipart body larger than `max_upload` or
// without a boundary, too many fields, a field that only the host sets
// (webapi/host_fields.h). A multipart body is not read here: it streams to
// the handler (`boundary`, `body_deadline_ms`).
bool ReadCgiRequest(int body_fd, uint64_t max_upload, const RequestClock& clock, CgiRequest* out,
                    std::string* reason);

// The value of cookie `name` in a Cookie header; empty when absent.
std::string CookieValue(const std::string& header, const std::string& name);
