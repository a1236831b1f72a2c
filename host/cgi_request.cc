#include "host/cgi_request.h"

#include <cstdlib>
#include <cstring>
#include <errno.h>
#include <unistd.h>

#include "webapi/host_fields.h"

namespace {

std::string Env(const char* name) {
  const char* v = getenv(name);
  return v ? v : "";
}

// Reads exactly `length` bytes by `deadline_ms`. False with `*reason` when
// the stream ends first or the deadline passes.
bool ReadBody(int fd, size_t length, int64_t deadline_ms, std::string* body, std::string* reason) {
  body->resize(length);
  size_t done = 0;
  while (done < length) {
    ssize_t n = ReadBeforeDeadline(fd, &(*body)[done], length - done, deadline_ms);
    if (n < 0 && errno == ETIMEDOUT) return (*reason = "request body not whole in time"), false;
    if (n <= 0) return (*reason = "request body shorter than its length"), false;
    done += static_cast<size_t>(n);
  }
  return true;
}

bool ParseLength(const std::string& text, size_t* length) {
  if (text.empty()) return (*length = 0), true;
  if (text.size() > 18 || text.find_first_not_of("0123456789") != std::string::npos) return false;
  *length = std::strtoull(text.c_str(), nullptr, 10);
  return true;
}

// "application/x-www-form-urlencoded; charset=UTF-8" -> "application/x-www-form-urlencoded".
std::string MediaType(const std::string& content_type) {
  std::string type = content_type.substr(0, content_type.find(';'));
  while (!type.empty() && type.back() == ' ') type.pop_back();
  for (char& c : type) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return type;
}

// "multipart/form-data; boundary=xyz" -> "xyz" (quotes removed).
std::string Boundary(const std::string& content_type) {
  size_t at = content_type.find("boundary=");
  if (at == std::string::npos) return "";
  std::string b = content_type.substr(at + 9);
  b = b.substr(0, b.find(';'));
  if (b.size() >= 2 && b.front() == '"' && b.back() == '"') b = b.substr(1, b.size() - 2);
  return b.size() <= 70 ? b : "";
}

bool ReadFormBody(int fd, uint64_t max_upload, const RequestClock& clock, CgiRequest* out,
                  std::string* reason) {
  size_t length = 0;
  if (!ParseLength(Env("CONTENT_LENGTH"), &length))
    return (*reason = "invalid CONTENT_LENGTH"), false;
  if (length == 0) return true;
  out->body_deadline_ms = BodyDeadlineMs(clock, length);
  std::string type = MediaType(Env("CONTENT_TYPE"));
  if (type == "multipart/form-data") {
    out->boundary = Boundary(Env("CONTENT_TYPE"));
    out->content_length = length;
    if (out->boundary.empty()) return (*reason = "multipart body without a boundary"), false;
    if (length > max_upload) {
      *reason = "upload larger than the limit of " + std::to_string(max_upload) + " bytes";
      return false;
    }
    return true;
  }
  if (!type.empty() && type != "application/x-www-form-urlencoded") {
    *reason = "unsupported content type: send application/x-www-form-urlencoded";
    return false;
  }
  if (length > kMaxBodyBytes) return (*reason = "request body too large"), false;
  std::string body;
  if (!ReadBody(fd, length, out->body_deadline_ms, &body, reason)) return false;
  std::string error;
  if (!ParseUrlEncoded(body, &out->body, &error)) return (*reason = "body: " + error), false;
  return true;
}

// The first field of `fields` that a client may not send (see host_fields.h).
const std::string* HostFieldIn(const FormFields& fields) {
  for (const auto& field : fields) {
    if (IsHostField(field.first)) return &field.first;
  }
  return nullptr;
}

}  // namespace

bool ReadCgiRequest(int body_fd, uint64_t max_upload, const RequestClock& clock, CgiRequest* out,
                    std::string* reason) {
  out->method = Env("REQUEST_METHOD");
  out->cookie = Env("HTTP_COOKIE");
  out->token = Env("HTTP_X_KIVO_TOKEN");
  out->accept_language = Env("HTTP_ACCEPT_LANGUAGE");
  if (out->method != "GET" && out->method != "POST") {
    *reason = "unsupported request method: use GET or POST";
    return false;
  }
  std::string error;
  if (!ParseUrlEncoded(Env("QUERY_STRING"), &out->query, &error)) {
    *reason = "query string: " + error;
    return false;
  }
  if (out->method == "POST" && !ReadFormBody(body_fd, max_upload, clock, out, reason)) return false;
  if (out->query.size() + out->body.size() > kMaxFields) {
    *reason = "too many parameters";
    return false;
  }
  for (const FormFields* fields : {&out->query, &out->body}) {
    if (const std::string* name = HostFieldIn(*fields)) {
      *reason = "the field " + *name + " is set by the appliance only";
      return false;
    }
  }
  return true;
}

std::string CookieValue(const std::string& header, const std::string& name) {
  size_t pos = 0;
  while (pos < header.size()) {
    size_t end = header.find(';', pos);
    if (end == std::string::npos) end = header.size();
    size_t start = header.find_first_not_of(' ', pos);
    if (start != std::string::npos && start < end) {
      std::string pair = header.substr(start, end - start);
      size_t eq = pair.find('=');
      if (eq != std::string::npos && pair.substr(0, eq) == name) return pair.substr(eq + 1);
    }
    pos = end + 1;
  }
  return "";
}
