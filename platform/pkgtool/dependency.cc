#include "pkgtool/dependency.h"

#include <cctype>

#include "klibc/json_text.h"
#include "pkgtool/registry.h"

namespace {

// Splits "id>=1.0" into its parts. False when the entry is malformed.
bool ParseEntry(const std::string& entry, PackageBasicInfo* out) {
  size_t op_at = entry.find_first_of("<>=!");
  std::string id = entry.substr(0, op_at);
  if (!PMSIsValidPackageId(id)) return false;
  if (op_at == std::string::npos) {
    *out = PackageBasicInfo(id, "");
    return true;
  }
  size_t version_at = entry.find_first_not_of("<>=!", op_at);
  if (version_at == std::string::npos) return false;
  PKG_VERSION_COMPOP op;
  std::string version = entry.substr(version_at);
  if (!PMSParseCompOp(entry.substr(op_at, version_at - op_at), &op) ||
      !PMSIsValidVersion(version)) {
    return false;
  }
  *out = PackageBasicInfo(id, op, version);
  return true;
}

std::string Trim(const std::string& s) {
  size_t b = s.find_first_not_of(" \t");
  size_t e = s.find_last_not_of(" \t");
  return b == std::string::npos ? "" : s.substr(b, e - b + 1);
}

}  // namespace

std::string PackageBasicInfo::toString() const {
  return constrained_ ? name_ + PMSCompOpText(op_) + version_ : name_;
}

void DepPkgVector::toJSON(Json::Value& out) const {
  out = Json::Value(Json::objectValue);
  for (const PackageBasicInfo& dep : *this) {
    Json::Value entry(Json::objectValue);
    if (dep.hasConstraint()) {
      entry["operator"] = PMSCompOpText(dep.getOperator());
      entry["version"] = dep.getVersion();
    }
    out[dep.getName()] = entry;
  }
}

std::string DepPkgVector::toString() const {
  std::string text;
  for (const PackageBasicInfo& dep : *this) text += (text.empty() ? "" : ":") + dep.toString();
  return text;
}

int PMSExplodeDepPKGString(const std::string& text, DepPkgVector& out) {
  out.clear();
  size_t start = 0;
  while (start <= text.size()) {
    size_t end = text.find(':', start);
    if (end == std::string::npos) end = text.size();
    std::string entry = Trim(text.substr(start, end - start));
    PackageBasicInfo dep;
    if (!entry.empty() && ParseEntry(entry, &dep)) out.push_back(dep);
    start = end + 1;
  }
  return static_cast<int>(out.size());
}

int PMSParseDepJSON(const Json::Value& value, DepPkgVector& out) {
  out.clear();
  if (value.isString()) return PMSExplodeDepPKGString(value.asString(), out);
  if (!value.isObject()) return 0;
  for (const std::string& id : value.getMemberNames()) {
    const Json::Value& entry = value[id];
    std::string text = id;
    if (entry.isObject() && entry["operator"].isString() && entry["version"].isString()) {
      text += entry["operator"].asString() + entry["version"].asString();
    }
    PackageBasicInfo dep;
    if (ParseEntry(text, &dep)) out.push_back(dep);
  }
  return static_cast<int>(out.size());
}

int PMSParseDepJSONString(const std::string& text, DepPkgVector& out) {
  out.clear();
  Json::Value value;
  if (!KIVOParseJson(text, &value)) return 0;
  return PMSParseDepJSON(value, out);
}

std::set<std::string> PMSServiceSet(const std::string& text) {
  std::set<std::string> names;
  std::string name;
  for (size_t i = 0; i <= text.size(); ++i) {
    char c = i < text.size() ? text[i] : ':';
    if (c == ':' || c == ' ' || c == ',' || c == '\t') {
      if (PMSIsValidPackageId(name)) names.insert(name);
      name.clear();
    } else {
      name += c;
    }
  }
  return names;
}

const std::vector<std::string>& PMSKnownServices() {
  static const std::vector<std::string> kServices = {"pgsql", "web", "ssh",  "smb",
                                                     "nfs",   "ftp", "mail", "vpn"};
  return kServices;
}

unsigned PMSServiceMask(const std::string& text) {
  unsigned mask = 0;
  const std::vector<std::string>& known = PMSKnownServices();
  for (const std::string& name : PMSServiceSet(text)) {
    for (size_t bit = 0; bit < known.size(); ++bit) {
      if (known[bit] == name) mask |= 1u << bit;
    }
  }
  return mask;
}
