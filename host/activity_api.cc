#include "host/activity_api.h"

#include <cstdio>
#include <ctime>
#include <string>
#include <syslog.h>

#include "activity/activity_log.h"
#include "klibc/json_text.h"
#include "pkgtool/registry.h"
#include "webapi/api_codes.h"

namespace {

using KivoActivity::Filter;

constexpr int kDefaultLimit = 50;
constexpr size_t kMaxText = 256;

void ParameterError(const char* name, const char* reason, APIResponse* response) {
  Json::Value data(Json::objectValue);
  data["name"] = name;
  data["reason"] = reason;
  response->SetError(kErrParameter, data);
}

// Reads an optional text parameter; false (with 120) when it is not text.
bool OptionalText(const APIRequest& request, const char* name, std::string* out,
                  APIResponse* response) {
  APIParameter<std::string> p = request.GetAndCheckString(name, PARAM_OPTIONAL);
  if (p.IsInvalid()) {
    ParameterError(name, "type", response);
    return false;
  }
  if (p.IsSet() && p.Get().size() > kMaxText) {
    ParameterError(name, "condition", response);
    return false;
  }
  if (p.IsSet()) *out = p.Get();
  return true;
}

// Reads an optional whole number from `min` to `max` into *out (kept when
// absent); false (with 120) otherwise.
bool OptionalNumber(const APIRequest& request, const char* name, long long min, long long max,
                    long long* out, APIResponse* response) {
  std::string text;
  if (!OptionalText(request, name, &text, response)) return false;
  if (text.empty()) return true;
  bool digits = text.size() <= 15 && text.find_first_not_of("0123456789") == std::string::npos;
  long long v = digits ? std::stoll(text) : -1;
  if (v < min || v > max) {
    ParameterError(name, "condition", response);
    return false;
  }
  *out = v;
  return true;
}

bool ValidOutcome(const std::string& s) {
  return s.empty() || s == KivoActivity::kStateSuccess || s == KivoActivity::kStateFailure ||
         s == KivoActivity::kStateUnfinished || s == KivoActivity::kStateRunning;
}

// Operation names are API and method names, or words such as "sign-in".
bool ValidOperation(const std::string& s) {
  for (char c : s) {
    bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
              c == '.' || c == '_' || c == '-' || c == ' ';
    if (!ok) return false;
  }
  return s.size() <= 64;
}

bool ReadFilter(const APIRequest& request, Filter* f, APIResponse* response) {
  constexpr long long kLatestMs = 253402300799999LL;  // the end of year 9999
  if (!OptionalText(request, "package", &f->package, response) ||
      !OptionalText(request, "account", &f->account, response) ||
      !OptionalText(request, "operation", &f->operation, response) ||
      !OptionalText(request, "outcome", &f->state, response) ||
      !OptionalNumber(request, "since", 0, kLatestMs, &f->since_ms, response) ||
      !OptionalNumber(request, "until", 0, kLatestMs, &f->until_ms, response)) {
    return false;
  }
  const char* bad = !f->package.empty() && !PMSIsValidPackageId(f->package) ? "package"
                    : !ValidOperation(f->operation)                         ? "operation"
                    : !ValidOutcome(f->state)                               ? "outcome"
                                                                            : nullptr;
  if (bad) ParameterError(bad, "condition", response);
  return bad == nullptr;
}

void LogUnreadable(APIResponse* response) {
  syslog(LOG_ERR, "%s:%d cannot read the activity log", "activity_api", __LINE__);
  Json::Value data(Json::objectValue);
  data["reason"] = "cannot read the activity log";
  response->SetError(kErrUnknown, data);
}

// "2024-05-01T12:00:00.123Z".
std::string IsoTime(const Json::Value& ms) {
  if (!ms.isInt64()) return "";
  time_t seconds = static_cast<time_t>(ms.asInt64() / 1000);
  struct tm utc;
  char text[40];
  if (!gmtime_r(&seconds, &utc)) return "";
  size_t n = strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%S", &utc);
  snprintf(text + n, sizeof(text) - n, ".%03dZ", static_cast<int>(ms.asInt64() % 1000));
  return text;
}

// One CSV field, always quoted. A value that a spreadsheet would take for a
// formula (a package's message, an account name as typed) gets a leading
// apostrophe so that opening the file never runs it.
std::string CsvField(const std::string& value) {
  std::string out = "\"";
  if (!value.empty() && std::string("=+-@\t\r").find(value[0]) != std::string::npos) out += '\'';
  for (char c : value) out += c == '"' ? std::string("\"\"") : std::string(1, c);
  return out + "\"";
}

std::string CsvLine(const Json::Value& e) {
  std::string packages;
  for (const Json::Value& p : e["packages"])
    packages += (packages.empty() ? "" : " ") + p.asString();
  const std::string fields[] = {e["id"].asString(),
                                IsoTime(e["started"]),
                                IsoTime(e["ended"]),
                                e["duration_ms"].isNull() ? "" : e["duration_ms"].asString(),
                                e["actor"].asString(),
                                e["origin"].asString(),
                                e["address"].asString(),
                                e["operation"].asString(),
                                packages,
                                KIVOWriteJson(e["target"]),
                                e["state"].asString(),
                                e["code"].isNull() ? "" : e["code"].asString(),
                                e["words"].asString()};
  std::string line;
  for (const std::string& f : fields) line += (line.empty() ? "" : ",") + CsvField(f);
  return line + "\r\n";
}

// Every entry that matches, newest first, read a page at a time.
bool AllEntries(const Filter& filter, Json::Value* all) {
  KivoActivity::ActivityLog log;
  *all = Json::Value(Json::arrayValue);
  for (long long offset = 0;; offset += KivoActivity::kMaxPage) {
    Json::Value page;
    long long total = 0;
    if (!log.List(filter, offset, KivoActivity::kMaxPage, &page, &total)) return false;
    for (Json::Value& e : page) all->append(std::move(e));
    if (page.size() < static_cast<unsigned>(KivoActivity::kMaxPage)) return true;
  }
}

void WriteFile(const std::string& type, const std::string& name, const std::string& body) {
  std::string head = "Content-Type: " + type + "\r\nContent-Disposition: attachment; filename=\"" +
                     name + "\"\r\nCache-Control: no-store\r\n\r\n";
  fwrite(head.data(), 1, head.size(), stdout);
  fwrite(body.data(), 1, body.size(), stdout);
  fflush(stdout);
}

}  // namespace

void ActivityList(const APIRequest& request, APIResponse* response) {
  Filter filter;
  long long offset = 0, limit = kDefaultLimit;
  if (!ReadFilter(request, &filter, response) ||
      !OptionalNumber(request, "offset", 0, 1000000000LL, &offset, response) ||
      !OptionalNumber(request, "limit", 1, KivoActivity::kMaxPage, &limit, response)) {
    return;
  }
  Json::Value entries;
  long long total = 0;
  KivoActivity::ActivityLog log;
  if (!log.List(filter, offset, static_cast<int>(limit), &entries, &total))
    return LogUnreadable(response);
  Json::Value data(Json::objectValue);
  data["entries"] = entries;
  data["total"] = static_cast<Json::Int64>(total);
  data["offset"] = static_cast<Json::Int64>(offset);
  data["limit"] = static_cast<Json::Int64>(limit);
  response->SetSuccess(data);
}

void ActivityExport(const APIRequest& request, APIResponse* response) {
  Filter filter;
  std::string format = "csv";
  if (!ReadFilter(request, &filter, response) ||
      !OptionalText(request, "format", &format, response)) {
    return;
  }
  if (format != "csv" && format != "json") return ParameterError("format", "condition", response);
  Json::Value all;
  if (!AllEntries(filter, &all)) return LogUnreadable(response);
  response->SetEnableOutput(false);
  if (format == "json") {
    return WriteFile("application/json; charset=utf-8", "activity.json", KIVOWriteJson(all));
  }
  std::string csv =
      "\"id\",\"started\",\"ended\",\"duration_ms\",\"actor\",\"origin\",\"address\","
      "\"operation\",\"packages\",\"target\",\"outcome\",\"code\",\"words\"\r\n";
  for (const Json::Value& e : all) csv += CsvLine(e);
  WriteFile("text/csv; charset=utf-8", "activity.csv", csv);
}
