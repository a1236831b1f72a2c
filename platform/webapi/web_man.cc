#include "webapi/web_man.h"

#include <cstdio>

namespace {

constexpr char kAdminGroup[] = "administrators";

// The caller of this process's one request, as the host handed it over.
struct Caller {
  std::string account;
  WebManGroupLookup in_group = nullptr;
};

Caller& CurrentCaller() {
  static Caller caller;
  return caller;
}

}  // namespace

void WebManSetCaller(const std::string& account, WebManGroupLookup in_group) {
  CurrentCaller() = Caller{account, in_group};
}

void WebManClearCaller() { CurrentCaller() = Caller{}; }

WebMan::WebMan(bool /*buffer_headers*/) {}

WebMan::~WebMan() {
  if (!header_written_) FlushHeader("");
}

bool WebMan::IsAuthorized(const char* /*app*/, int /*level*/, _tag_cgi_position /*position*/) {
  return !CurrentCaller().account.empty();
}

bool WebMan::LoadIn() {
  user_ = CurrentCaller().account;
  loaded_ = !user_.empty();
  return loaded_;
}

bool WebMan::IsAdmin() const {
  const Caller& caller = CurrentCaller();
  // The caller could have changed since LoadIn; only the loaded one counts.
  if (!loaded_ || caller.in_group == nullptr || caller.account != user_) return false;
  return caller.in_group(user_, kAdminGroup);
}

void WebMan::AddHeader(const std::string& name, const std::string& value) {
  headers_.push_back(name + ": " + value);
}

void WebMan::WriteHeader(const std::string& content_type) {
  if (!header_written_) FlushHeader(content_type);
}

void WebMan::FlushHeader(const std::string& content_type) {
  header_written_ = true;
  for (const std::string& line : headers_) printf("%s\r\n", line.c_str());
  if (!content_type.empty()) printf("Content-Type: %s\r\n", content_type.c_str());
  printf("\r\n");
}
