#include "webapi/api_validator.h"

#include "webapi/webapi_util.h"

namespace APIValidator {

bool IsBelong(const std::string& value, const Json::Value& set) {
  return WebAPIUtil::JsonArrayHasString(set, value);
}

bool IsBelong(const Json::Value& value, const Json::Value& set) {
  if (value.isString()) return IsBelong(value.asString(), set);
  if (!value.isArray()) return false;
  for (const Json::Value& item : value) {
    if (!item.isString() || !IsBelong(item.asString(), set)) return false;
  }
  return true;
}

bool IsEqual(const std::string& value, const std::string& expected) { return value == expected; }

}  // namespace APIValidator
