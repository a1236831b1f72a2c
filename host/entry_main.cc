// One web API request, start to end: the whole of entry.cgi, shared with
// the children of kivo-webd.

#include "host/entry_main.h"

#include <cstdio>
#include <cstring>
#include <dlfcn.h>
#include <exception>
#include <fcntl.h>
#include <memory>
#include <string>
#include <syslog.h>
#include <unistd.h>

#include "host/activity_record.h"
#include "host/cgi_request.h"
#include "host/host_api.h"
#include "host/host_config.h"
#include "host/module_table.h"
#include "host/multipart/multipart_source.h"
#include "host/session_store.h"
#include "webapi/api_names.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"
#include "webapi/api_upload.h"

namespace {

Json::Value Reason(const std::string& reason) {
  Json::Value data(Json::objectValue);
  data["reason"] = reason;
  return data;
}

// Methods that browsers load by URL (images, the inline-frame page) cannot
// send the token header; they answer only images and a blank page.
bool IsLoadedByURL(const std::string& api, const std::string& method) {
  static const char* const kAPIs[] = {WebAPIName::kThumb, WebAPIName::kServerThumb,
                                      WebAPIName::kScreenshot, WebAPIName::kServerScreenshot,
                                      WebAPIName::kFakeIFrame};
  if (method != "get") return false;
  for (const char* a : kAPIs) {
    if (api == a) return true;
  }
  return false;
}

// "de-DE,de;q=0.9" -> "ger". The interface language picks package texts.
std::string UILanguage(const std::string& accept_language) {
  static const struct {
    const char* prefix;
    const char* code;
  } kLanguages[] = {{"de", "ger"}, {"fr", "fre"}, {"it", "ita"}, {"es", "spn"},
                    {"ja", "jpn"}, {"ko", "krn"}, {"nl", "nld"}, {"zh-tw", "cht"},
                    {"zh", "chs"}, {"ru", "rus"}, {"pt", "ptb"}, {"en", "enu"}};
  std::string first = accept_language.substr(0, accept_language.find_first_of(",;"));
  for (char& c : first) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  for (const auto& l : kLanguages) {
    if (first.compare(0, strlen(l.prefix), l.prefix) == 0) return l.code;
  }
  return "enu";
}

// "api", "method" and "version" of the call; false when one is missing.
bool ReadIdentity(APIRequest* request) {
  APIParameter<std::string> api = request->GetAndCheckString("api", PARAM_REQUIRED);
  APIParameter<std::string> method = request->GetAndCheckString("method", PARAM_REQUIRED);
  APIParameter<std::string> version = request->GetAndCheckString("version", PARAM_REQUIRED);
  if (api.IsInvalid() || method.IsInvalid() || version.IsInvalid() || api.Get().empty() ||
      method.Get().empty()) {
    return false;
  }
  const std::string& v = version.Get();
  if (v.empty() || v.size() > 9 || v.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  request->SetAPI(api.Get(), method.Get(), std::stoi(v));
  return true;
}

void RunModuleAPI(const CgiRequest& cgi, APIRequest* request, APIResponse* response) {
  ModuleTable modules(DefaultModuleDir());
  Route route;
  switch (modules.Find(request->GetAPIClass(), request->GetAPIMethod(), request->GetAPIVersion(),
                       &route)) {
    case RouteResult::UnknownAPI:
      return response->SetError(kErrNoSuchAPI);
    case RouteResult::UnknownMethod:
      return response->SetError(kErrNoSuchMethod);
    case RouteResult::UnsupportedVersion:
      return response->SetError(kErrBadVersion);
    case RouteResult::Found:
      break;
  }
  bool by_url = IsLoadedByURL(request->GetAPIClass(), request->GetAPIMethod());
  if (!AuthorizeAdministrator(cgi, by_url, request, response)) return;
  // Begun before the checker, so that a refused change is on record too.
  CallRecord record(*request, request->GetLoginUserName());
  if (!route.checker || route.checker(request, response)) route.handler(request, response);
  record.Finish(*response);
}

// Opens the multipart reader library beside the platform library and reads
// the fields posted before the file. Null (with `*reason`) on failure.
std::unique_ptr<UploadSource> OpenUpload(const CgiRequest& cgi, APIRequest* request,
                                         std::string* reason) {
  // The web server feeds the body through a pipe of 64 KiB by default; a
  // larger one means far fewer wake-ups per upload. Best effort.
  fcntl(STDIN_FILENO, F_SETPIPE_SZ, 1 << 20);
  std::string lib = DefaultModuleDir() + "/../../libkivo_multipart.so";
  void* handle = dlopen(lib.c_str(), RTLD_NOW | RTLD_LOCAL);
  auto open =
      handle ? reinterpret_cast<KivoOpenMultipartFn>(dlsym(handle, "KivoOpenMultipart")) : nullptr;
  std::unique_ptr<UploadSource> source(
      open ? open(STDIN_FILENO, cgi.content_length, cgi.boundary.c_str(), cgi.body_deadline_ms)
           : nullptr);
  Json::Value fields(Json::objectValue);
  if (!source || source->ReadFields(fields) != UPLOAD_OK) {
    *reason = source ? "malformed multipart body" : "cannot read multipart bodies";
    return nullptr;
  }
  for (const std::string& name : fields.getMemberNames())
    request->AddRawParam(name, fields[name].asString());
  return source;
}

void Serve(const RequestClock& clock, APIRequest* request, APIResponse* response) {
  CgiRequest cgi;
  std::string reason;
  if (!ReadCgiRequest(STDIN_FILENO, LoadUploadLimit(), clock, &cgi, &reason)) {
    return response->SetError(kErrBadRequest, Reason(reason));
  }
  for (const auto& field : cgi.query) request->AddRawParam(field.first, field.second);
  for (const auto& field : cgi.body) request->AddRawParam(field.first, field.second);
  std::unique_ptr<UploadSource> upload;
  if (!cgi.boundary.empty()) {
    upload = OpenUpload(cgi, request, &reason);
    if (!upload) return response->SetError(kErrBadRequest, Reason(reason));
    request->SetUploadSource(upload.get());
  }
  if (!ReadIdentity(request)) {
    return response->SetError(kErrBadRequest, Reason("api, method and version are required"));
  }
  request->SetUILanguage(UILanguage(cgi.accept_language));
  if (IsHostAPI(request->GetAPIClass())) {
    std::unique_ptr<ModuleTable> modules;
    if (request->GetAPIClass() == WebAPIName::kInfo)
      modules.reset(new ModuleTable(DefaultModuleDir()));
    return RunHostAPI(cgi, request, modules.get(), response);
  }
  RunModuleAPI(cgi, request, response);
  request->SetUploadSource(nullptr);
}

void WriteAnswer(APIResponse& response) {
  std::string body = response.TakeEnvelopeText();
  std::string head = "Content-Type: application/json; charset=utf-8\r\n";
  for (const std::string& h : response.Headers()) head += h + "\r\n";
  head += "Cache-Control: no-store\r\n\r\n";
  fwrite(head.data(), 1, head.size(), stdout);
  fwrite(body.data(), 1, body.size(), stdout);
  fflush(stdout);
}

}  // namespace

int RunEntryRequest(const RequestClock& clock) {
  openlog("entry.cgi", LOG_PID | LOG_PERROR, LOG_USER);
  const pid_t self = getpid();
  APIRequest request;
  APIResponse response;
  try {
    Serve(clock, &request, &response);
  } catch (const std::exception& e) {
    if (getpid() == self) {
      syslog(LOG_ERR, "%s:%d %s %s failed: %s", "entry", __LINE__, request.GetAPIClass().c_str(),
             request.GetAPIMethod().c_str(), e.what());
      response.SetError(kErrUnknown);
    }
  }
  // A worker forked by a handler that came back here must not answer the
  // request a second time.
  if (getpid() != self) _exit(0);
  if (response.IsOutputEnabled()) WriteAnswer(response);
  return 0;
}
