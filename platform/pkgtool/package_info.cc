// The package tool's record of a package: its INFO keys read and checked
// (the web API renders it for answers in package/package_info.cc).

#include "pkgtool/package_info.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>

#include "pkgtool/data_snapshot.h"
#include "pkgtool/health_gate.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/registry.h"
#include "pkgtool/root_request.h"

#include <strings.h>

const PMSWizardFile kPMSWizardFiles[3] = {{"WIZARD_UIFILES/install_uifile", PKG_OP_INSTALL},
                                          {"WIZARD_UIFILES/upgrade_uifile", PKG_OP_UPGRADE},
                                          {"WIZARD_UIFILES/uninstall_uifile", PKG_OP_UNINSTALL}};

const char* PMSWizardMember(int op) {
  for (const PMSWizardFile& w : kPMSWizardFiles) {
    if (w.op == op) return w.member;
  }
  return kPMSWizardFiles[0].member;
}

std::string PackageInfo::get(const std::string& key) const {
  auto it = info_.find(key);
  return it == info_.end() ? "" : it->second;
}

bool PackageInfo::getBool(const std::string& key, bool def) const {
  auto it = info_.find(key);
  if (it == info_.end() || it->second.empty()) return def;
  const char* v = it->second.c_str();
  return strcasecmp(v, "yes") == 0 || strcasecmp(v, "true") == 0 || strcmp(v, "1") == 0;
}

std::string PackageInfo::getLocalized(const std::string& key, const std::string& language) const {
  std::string localized = get(key + "_" + language);
  return localized.empty() ? get(key) : localized;
}

std::string PackageInfo::getDisplayName(const std::string& language) const {
  std::string name = getLocalized("displayname", language);
  return name.empty() ? getId() : name;
}

int PackageInfo::getAdminPort() const {
  long port = std::strtol(get("adminport").c_str(), nullptr, 10);
  return port > 0 && port < 65536 ? static_cast<int>(port) : 0;
}

DepPkgVector PackageInfo::getDependencies() const {
  DepPkgVector deps;
  PMSExplodeDepPKGString(get("install_dep_packages"), deps);
  return deps;
}

DepPkgVector PackageInfo::getConflicts() const {
  DepPkgVector conflicts;
  PMSExplodeDepPKGString(get("install_conflict_packages"), conflicts);
  return conflicts;
}

bool PackageInfo::hasWizard(PKG_INSTALLATION_TYPE op) const { return (wizard_mask_ & op) != 0; }

namespace {

bool IsYesNo(const std::string& v) {
  return v.empty() || strcasecmp(v.c_str(), "yes") == 0 || strcasecmp(v.c_str(), "no") == 0 ||
         v == "true" || v == "false";
}

// "7.1-0042": major.minor-build.
bool IsOSVersion(const std::string& v) {
  int major, minor, build;
  char tail;
  return sscanf(v.c_str(), "%d.%d-%d%c", &major, &minor, &build, &tail) == 3;
}

// No NUL or other control character (a tab aside): values reach paths, C
// strings and script environments, where such a byte would cut or bend them.
bool IsPlainText(const std::string& v) {
  return std::none_of(v.begin(), v.end(), [](char c) {
    unsigned char u = static_cast<unsigned char>(c);
    return (u < 0x20 && u != '\t') || u == 0x7f;
  });
}

// KiB as decimal digits, at most 12 of them, so the byte count cannot
// overflow.
bool IsKiBCount(const std::string& v) {
  return !v.empty() && v.size() <= 12 && v.find_first_not_of("0123456789") == std::string::npos;
}

using InfoGetter = std::function<std::string(const char*)>;

// Each check below answers "" or "<key>: what is wrong".
std::string CheckIdentity(const InfoGetter& get) {
  if (!PMSIsValidPackageId(get("package"))) {
    return "package: required, 1 to 64 characters of A-Z a-z 0-9 . _ + -, starting with a letter "
           "or digit";
  }
  if (!PMSIsValidVersion(get("version"))) {
    return "version: required, up to 32 characters of A-Z a-z 0-9 . _ + - with at least one digit";
  }
  return "";
}

std::string CheckForms(const InfoGetter& get) {
  for (const char* key : {"beta", "startable", "silent_install", "silent_upgrade",
                          "silent_uninstall", "install_reboot", "support_center", "ctl_uninstall",
                          "checkport", kPMSDataCopyKey, kPMSRunAsRootKey}) {
    if (!IsYesNo(get(key))) return std::string(key) + ": must be yes or no";
  }
  for (const char* key : {"os_min_ver", "os_max_ver"}) {
    if (!get(key).empty() && !IsOSVersion(get(key))) {
      return std::string(key) + ": must look like 7.1-0042 (major.minor-build)";
    }
  }
  std::string port = get("adminport");
  if (!port.empty() &&
      (port.find_first_not_of("0123456789") != std::string::npos || port.size() > 5 ||
       std::atoi(port.c_str()) < 1 || std::atoi(port.c_str()) > 65535)) {
    return "adminport: must be a port number from 1 to 65535";
  }
  std::string protocol = get("adminprotocol");
  if (!protocol.empty() && protocol != "http" && protocol != "https") {
    return "adminprotocol: must be http or https";
  }
  if (!get("extractsize").empty() && !IsKiBCount(get("extractsize"))) {
    return "extractsize: must be a number of KiB (up to 12 digits)";
  }
  return "";
}

std::string CheckPathsAndNames(const InfoGetter& get) {
  for (const char* key : {"logfile", "pidfile"}) {
    if (!get(key).empty() && !PMSIsContainedRelativePath(get(key))) {
      return std::string(key) + ": must be a relative path inside the package's data folder";
    }
  }
  for (const char* key : {"install_dep_packages", "install_conflict_packages"}) {
    std::string text = get(key);
    DepPkgVector deps;
    size_t entries = text.empty() ? 0 : std::count(text.begin(), text.end(), ':') + 1;
    if (static_cast<size_t>(PMSExplodeDepPKGString(text, deps)) != entries) {
      return std::string(key) +
             ": entries are id or id<op>version separated by ':' (op: = > >= < <= !=)";
    }
  }
  return "";
}

std::string CheckText(const KeyValueMap& info) {
  for (const auto& kv : info) {
    if (!IsPlainText(kv.first)) return "INFO: a key holds a control character";
    if (!IsPlainText(kv.second)) return kv.first + ": holds a control character";
    if (kv.second.size() > 4096) return kv.first + ": longer than 4096 characters";
  }
  return "";
}

}  // namespace

std::string PMSCheckInfo(const KeyValueMap& info, std::string* field) {
  InfoGetter get = [&info](const char* key) {
    auto it = info.find(key);
    return it == info.end() ? std::string() : it->second;
  };
  // Text first: the checks after it may take a value as a C string.
  std::string problem = CheckText(info);
  if (problem.empty()) problem = CheckIdentity(get);
  if (problem.empty()) problem = CheckForms(get);
  if (problem.empty()) problem = CheckPathsAndNames(get);
  if (problem.empty()) problem = PMSHealthInfoProblem(info);
  if (problem.empty()) problem = PackageLimitsInfoProblem(info);
  if (field) *field = problem.substr(0, problem.find(':'));
  return problem;
}
