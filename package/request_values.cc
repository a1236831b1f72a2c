#include "request_values.h"

#include "pkgtool/registry.h"

namespace KIVO_PACKAGE {

bool IsPackageId(const std::string& id) { return PMSIsValidPackageId(id); }

bool AreIdsOrEmpty(const Json::Value& value) {
  if (value.isString()) return value.asString().empty() || IsPackageId(value.asString());
  if (!value.isArray()) return false;
  for (const Json::Value& item : value) {
    if (!item.isString() || !AreIdsOrEmpty(item)) return false;
  }
  return true;
}

bool IsCleanText(const std::string& text) {
  return !text.empty() && text.find('\0') == std::string::npos;
}

bool HasNoNul(const std::string& text) { return text.find('\0') == std::string::npos; }

bool SinglePackageId(const Json::Value& value, std::string* id) {
  const Json::Value& one = value.isArray() && value.size() == 1 ? value[0] : value;
  if (!one.isString() || !IsPackageId(one.asString())) return false;
  *id = one.asString();
  return true;
}

}  // namespace KIVO_PACKAGE
