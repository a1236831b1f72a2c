#include "webapi/webapi_util.h"

#include <algorithm>
#include <memory>

#include "klibc/json_text.h"

namespace WebAPIUtil {
namespace {

bool MayBeJson(const std::string& raw) {
  if (raw.empty()) return false;
  char c = raw[0];
  return c == '{' || c == '[' || c == '"' || c == '-' || (c >= '0' && c <= '9') || c == 't' ||
         c == 'f' || c == 'n';
}

// True when a string or member name anywhere in `value` holds a NUL
// character (JSON can spell it \u0000).
bool HoldsNul(const Json::Value& value) {
  if (value.isString()) {
    const char* begin = nullptr;
    const char* end = nullptr;
    return value.getString(&begin, &end) && std::find(begin, end, '\0') != end;
  }
  if (value.isArray()) {
    for (const Json::Value& item : value) {
      if (HoldsNul(item)) return true;
    }
  }
  if (value.isObject()) {
    for (auto it = value.begin(); it != value.end(); ++it) {
      if (it.name().find('\0') != std::string::npos || HoldsNul(*it)) return true;
    }
  }
  return false;
}

}  // namespace

bool ParseJson(const std::string& text, Json::Value& out) {
  Json::Value parsed;
  if (!KIVOParseJson(text, &parsed)) return false;
  out = std::move(parsed);
  return true;
}

bool JsonArrayHasString(const Json::Value& array, const std::string& value) {
  if (!array.isArray()) return false;
  for (const Json::Value& item : array) {
    if (item.isString() && item.asString() == value) return true;
  }
  return false;
}

Json::Value DecodeParamValue(const std::string& raw) {
  Json::Value value;
  if (!MayBeJson(raw) || !KIVOParseJson(raw, &value)) return Json::Value(raw);
  // Reals keep their text, and so do integers too large for 64 bits, which
  // jsoncpp reads as reals.
  if (value.type() == Json::realValue) return Json::Value(raw);
  // A decoded NUL would cut a value short wherever it becomes a C string, so
  // such JSON is not decoded: its text as sent holds no NUL.
  if (HoldsNul(value)) return Json::Value(raw);
  return value;
}

}  // namespace WebAPIUtil
