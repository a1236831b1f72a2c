#include "utils/package_utils.h"

#include <cstdlib>
#include <string>
#include <vector>

#include "klibc/json_text.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "webapi/cgi_encode.h"

#include <strings.h>

namespace PackageUtils {

namespace {

struct NamedBit {
  const char* name;
  uint64_t bit;
};

const NamedBit kNames[] = {
    {"description", kDescription},
    {"description_enu", kDescriptionEnu},
    {"beta", kBeta},
    {"distributor", kDistributor},
    {"distributor_url", kDistributorUrl},
    {"maintainer", kMaintainer},
    {"maintainer_url", kMaintainerUrl},
    {"nvx_apps", kNvxApps},
    {"help_url", kHelpUrl},
    {"report_beta_url", kReportBetaUrl},
    {"startable", kStartable},
    {"support_url", kSupportUrl},
    {"install_reboot", kInstallReboot},
    {"url", kUrl},
    {"status", kStatus},
    {"installed_info", kInstalledInfo},
    {"is_uninstall_pages", kIsUninstallPages},
    {"uninstall_pages", kUninstallPages},
    {"silent_install", kSilentInstall},
    {"silent_upgrade", kSilentUpgrade},
    {"silent_uninstall", kSilentUninstall},
    {"install_type", kInstallType},
    {"autoupdate", kAutoupdate},
    {"support_center", kSupportCenter},
    {"dependent_packages", kDependentPackages},
    {"start_dependent_services", kStartDependentServices},
    {"installing_progress", kInstallingProgress},
    {"ctl_uninstall", kCtlUninstall},
    {"log_path", kLogPath},
};

// URL-encodes `text` into a buffer of three times its length plus one, as
// the desktop expects; false when the encoder fails.
bool Encode(const std::string& text, std::string* out) {
  std::vector<char> buf(text.size() * 3 + 1, '\0');
  if (KivoCgiURLEncode(text.c_str(), buf.data(), static_cast<int>(text.size() * 3 + 1)) != 0) {
    return false;
  }
  *out = buf.data();
  return true;
}

}  // namespace

uint64_t ParseAdditional(const Json::Value& names) {
  uint64_t mask = 0;
  if (!names.isArray()) return 0;
  for (const Json::Value& name : names) {
    if (!name.isString()) continue;
    for (const NamedBit& n : kNames) {
      if (strcasecmp(name.asCString(), n.name) == 0) mask |= n.bit;
    }
  }
  return mask;
}

bool IsAdditionalName(const std::string& name) {
  for (const NamedBit& n : kNames) {
    if (name == n.name) return true;
  }
  return false;
}

void DumpInfo(const PackageInfo& info, uint64_t mask, Json::Value& out) {
  out["id"] = info.getId();
  out["version"] = info.getVersion();
  out["name"] = info.getDisplayName();
  if (mask == 0) return;
  if (!out.isMember("additional")) out["additional"] = Json::Value(Json::objectValue);
  DumpAdditionalInfo(info, mask, out["additional"]);
}

void DumpAdditionalInfo(const PackageInfo& info, uint64_t mask, Json::Value& a) {
  auto text = [&](uint64_t bit, const char* member, const std::string& value) {
    if (mask & bit) a[member] = value;
  };
  auto flag = [&](uint64_t bit, const char* member, bool value) {
    if (mask & bit) a[member] = value;
  };
  text(kDescription, "description", info.getDescription());
  std::string english = info.get("description_enu");
  text(kDescriptionEnu, "description_enu", english.empty() ? info.get("description") : english);
  if (mask & kBeta) {
    a["beta"] = false;
    if (info.isBeta()) a["beta"] = true;
  }
  text(kDistributor, "distributor", info.get("distributor"));
  text(kDistributorUrl, "distributor_url", info.get("distributor_url"));
  text(kMaintainer, "maintainer", info.get("maintainer"));
  text(kMaintainerUrl, "maintainer_url", info.get("maintainer_url"));
  text(kNvxApps, "nvx_apps", info.get("nvx_apps"));
  text(kHelpUrl, "help_url", info.get("helpurl"));
  text(kReportBetaUrl, "report_beta_url", info.get("report_url"));
  flag(kSupportCenter, "support_center", info.getBool("support_center"));
  flag(kStartable, "startable", info.isStartable());
  text(kSupportUrl, "support_url", info.get("support_url"));
  flag(kInstallReboot, "install_reboot", info.getBool("install_reboot"));
  flag(kIsUninstallPages, "is_uninstall_pages", info.hasWizard(PKG_OP_UNINSTALL));
  flag(kSilentInstall, "silent_install", info.getBool("silent_install"));
  flag(kSilentUpgrade, "silent_upgrade", info.getBool("silent_upgrade"));
  // Kept as it has always been: "silent_uninstall" follows the
  // "silent_install" bit, and its own bit is never looked at.
  flag(kSilentInstall, "silent_uninstall", info.getBool("silent_uninstall"));
  text(kInstallType, "install_type", info.get("install_type"));
  if (mask & kDependentPackages) {
    Json::Value deps;
    info.getDependencies().toJSON(deps);
    a["dependent_packages"] = deps;
  }
  if (mask & kStartDependentServices) {
    Json::Value services(Json::arrayValue);
    PackageManager().parseService(info.getServiceString(), services);
    a["start_dependent_services"] = services;
  }
  flag(kCtlUninstall, "ctl_uninstall", PMSGetCtlUninstall(info));
}

void DumpLicense(const PackageInfo& info, Json::Value& out) {
  std::string encoded;
  if (!info.getLicense().empty() && Encode(info.getLicense(), &encoded)) out["licence"] = encoded;
}

void DumpUIFIle(const PackageInfo& info, Json::Value& out) {
  const Json::Value& ui = info.getUIFile();
  if (ui.isNull() || ui.empty()) return;
  std::string encoded;
  if (Encode(KIVOWriteJson(ui), &encoded)) out = encoded;
}

}  // namespace PackageUtils
