// Calls the real entry.cgi the way the web server does: a CGI environment,
// the body on stdin, the answer read from stdout.
#pragma once

#include <map>
#include <string>
#include <utility>
#include <vector>

#include <json/value.h>

struct CgiAnswer {
  std::string head;  // header lines
  std::string body;  // raw body
  Json::Value json;  // the body parsed, null when it is not JSON
  int exit_status = -1;

  bool Success() const { return json["success"].asBool(); }
  int Code() const { return json["error"]["code"].asInt(); }
  const Json::Value& Errors() const { return json["error"]["errors"]; }
  const Json::Value& Data() const { return json["data"]; }
};

using CgiEnv = std::map<std::string, std::string>;
using Params = std::vector<std::pair<std::string, std::string>>;

// A multipart/form-data body of `fields` and a file part "file" with
// `content`; *content_type gets the header value.
std::string MultipartBody(const Params& fields, const std::string& file_name,
                          const std::string& content, std::string* content_type,
                          const std::string& part = "file");

// Runs entry.cgi with `env` (plus KIVO_ROOT and PATH) and `body` on stdin.
CgiAnswer RunEntryCgi(const CgiEnv& env, const std::string& body = "");

// "a=1&b=2" with each name and value percent-encoded.
std::string EncodeForm(const Params& params);

// A signed-in client of the web API.
class ApiClient {
 public:
  // Signs in `account`; check signed_in().
  ApiClient(const std::string& account, const std::string& password);

  bool signed_in() const { return !sid_.empty(); }
  const std::string& sid() const { return sid_; }
  const std::string& token() const { return token_; }

  // Calls api/method/version with `params` in a form body, carrying the
  // session as cookie and token header, as the web desktop does.
  CgiAnswer Call(const std::string& api, const std::string& method, int version,
                 const Params& params = {}) const;
  // Posts `fields` and the file `path` (field "file") as multipart/form-data,
  // with api, method and version in the query string, as the desktop does.
  CgiAnswer Upload(const std::string& api, const std::string& method, int version,
                   const Params& fields, const std::string& path) const;
  // Posts `content` as the multipart file part `part` named `file_name`,
  // with api, method and version in the query string.
  CgiAnswer PostFilePart(const std::string& api, const std::string& method, int version,
                         const std::string& part, const std::string& file_name,
                         const std::string& content, const Params& fields = {}) const;

 private:
  std::string sid_;
  std::string token_;
};
