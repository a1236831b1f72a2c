#include "pkgtool/package_info.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "pkgtool/registry.h"

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

bool IsCleanText(const std::string& v) { return v.size() <= 4096; }

}  // namespace

std::string PMSCheckInfo(const KeyValueMap& info) {
  auto get = [&info](const char* key) {
    auto it = info.find(key);
    return it == info.end() ? std::string() : it->second;
  };
  if (!PMSIsValidPackageId(get("package"))) {
    return "package: required, 1 to 64 characters of A-Z a-z 0-9 . _ + -, starting with a letter "
           "or digit";
  }
  if (!PMSIsValidVersion(get("version"))) {
    return "version: required, up to 32 characters of A-Z a-z 0-9 . _ + - with at least one digit";
  }
  for (const char* key :
       {"beta", "startable", "silent_install", "silent_upgrade", "silent_uninstall",
        "install_reboot", "support_center", "ctl_uninstall", "checkport"}) {
    if (!IsYesNo(get(key))) return std::string(key) + ": must be yes or no";
  }
  for (const char* key : {"os_min_ver", "os_max_ver"}) {
    if (!get(key).empty() && !IsOSVersion(get(key))) {
      return std::string(key) + ": must look like 7.1-0042 (major.minor-build)";
    }
  }
  std::string port = get("adminport");
  if (!port.empty() && (port.find_first_not_of("0123456789") != std::string::npos ||
                        std::atoi(port.c_str()) < 1 || std::atoi(port.c_str()) > 65535)) {
    return "adminport: must be a port number from 1 to 65535";
  }
  std::string protocol = get("adminprotocol");
  if (!protocol.empty() && protocol != "http" && protocol != "https") {
    return "adminprotocol: must be http or https";
  }
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
  for (const auto& kv : info) {
    if (!IsCleanText(kv.second)) return kv.first + ": longer than 4096 characters";
  }
  return "";
}
