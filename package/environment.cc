// The installation environment check: before an install, is the appliance
// ready for the package? Space and a volume, no conflict, the services and
// packages it needs running, the package tool free, no running dependents.

#include <cstdlib>
#include <unistd.h>

#include "error_codes.h"
#include "klibc/last_error.h"
#include "package_webapi.h"
#include "pkgtool/pms.h"
#include "request_values.h"
#include "storage/device_info.h"
#include "storage/volume_list.h"
#include "storage/volume_lookup.h"
#include "webapi/upload_area.h"

namespace KIVO_PACKAGE {

namespace {

constexpr uint64_t kTinboxReserve = 10485760;  // 10 MiB

}  // namespace

bool PackageWebAPI::VolumeListGet(Json::Value& out) {
  int64_t size = std::strtoll(request->GetParam("size", "0").asString().c_str(), nullptr, 10);
  std::string tmp;
  if (!PMSGetTmpDir(size, tmp)) {
    int err = KLIBCErrGet();
    response->SetError(err == KLIBC_ERR_NO_SPACE     ? kErrNoSpace
                       : err == KLIBC_ERR_NO_TMP_DIR ? kErrNoTmpDir
                                                     : kErrNoVolume,
                       Json::Value());
    return false;
  }
  // The probe folder was only to learn that there is room.
  rmdir(tmp.c_str());
  // The package file comes through the upload area: a check that called the
  // appliance ready while an upload would fail there would send the user
  // into an install that cannot start.
  std::string probe;
  int stored = KIVOCreateUploadFile(size > 0 ? static_cast<uint64_t>(size) : 0, &probe);
  if (stored != UPLOAD_OK) {
    response->SetError(UploadError(stored), Json::Value());
    return false;
  }
  unlink(probe.c_str());
  KIVO::PXS::STORAGE_WEBUTILS::Volume volumes(1);
  if (!volumes.VolumeListGet(out, false) || out["volume_count"].asUInt() == 0) {
    response->SetError(kErrNoVolume, Json::Value());
    return false;
  }
  return true;
}

// Tinbox devices install on /volume1 only; returns false with the error set.
bool PackageWebAPI::TinboxSpaceOk(const std::string& install_type) {
  int64_t size = std::strtoll(request->GetParam("size", "0").asString().c_str(), nullptr, 10);
  if (install_type != "system") {
    Json::Value list(Json::objectValue);
    KIVO::PXS::STORAGE_WEBUTILS::Volume volumes(12);
    if (!volumes.VolumeListGet(list, false) || list["volume_count"].asUInt() == 0) {
      response->SetError(kErrVolumeUnusable, Json::Value());
      return false;
    }
  }
  KIVOMountVolInfo info;
  if (KIVOMountVolInfoGet("/volume1", &info) != 0) return true;
  if (!info.available || info.free_bytes <= static_cast<uint64_t>(size) + kTinboxReserve) {
    response->SetError(kErrNoRoomOnVolume, Json::Value());
    return false;
  }
  return true;
}

void PackageWebAPI::CheckEnv() {
  std::string id;
  const Json::Value id_param = request->GetParam("id", "");
  const bool no_id = id_param.isString() ? id_param.asString().empty() : id_param.empty();
  const std::string depsers = request->GetParam("depsers", "").asString();
  if ((!no_id && !SinglePackageId(id_param, &id)) || !HasNoNul(depsers)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  const std::string deppkgs = request->GetParam("deppkgs", "").toStyledString();
  const std::string conflicts = request->GetParam("conflictpkgs", "").toStyledString();
  const std::string install_type = request->GetParam("install_type", "").asString();
  const int version = request->GetParam("version", 1).asInt();
  const std::string package_version = version == 1 ? "1" : request->GetParam("ver", "").asString();
  PackageManager manager;
  const bool tinbox = KLIBCIsTinbox();
  Json::Value result(Json::objectValue);
  if (tinbox && !TinboxSpaceOk(install_type)) return;
  if (!VolumeListGet(result)) {
    if (install_type != "system" && install_type != "cluster") return;
    result = Json::Value(Json::objectValue);
  }
  if (!CheckEnvConflicts(manager, id, package_version, conflicts, result)) return;
  if (!CheckEnvServices(manager, depsers, version, result)) return;
  if (!CheckEnvDependencies(manager, deppkgs, result)) return;
  if (!tinbox) {
    std::string volume;
    bool ok = id.empty() || !PMSCheckPackage(id) ? PMSGetPackageDefVol(volume)
                                                 : PMSGetPackageVol(id, volume);
    if (ok) result["volume_path"] = volume;
  }
  result["is_occupied"] = !manager.ExLock(5);
  manager.UnLock();
  if (!CheckEnvDependents(manager, id, result)) return;
  response->SetSuccess(result);
}

bool PackageWebAPI::CheckEnvConflicts(PackageManager& manager, const std::string& id,
                                      const std::string& version, const std::string& conflicts,
                                      Json::Value& result) {
  DepPkgVector list;
  // The JSON text of an absent parameter is an empty string ("\"\"\n"), of a
  // null one "null": only the second runs the test with an empty list.
  std::string text = conflicts;
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
  if (text != "null" && PMSParseDepJSONString(conflicts, list) == 0) return true;
  std::string message;
  if (manager.arePackagesConflict(PackageBasicInfo(id, version), list, message,
                                  request->GetUILanguage().c_str()) &&
      !message.empty()) {
    result["packages"] = message;
    response->SetError(kErrConflict, result);
    return false;
  }
  return true;
}

bool PackageWebAPI::CheckEnvServices(PackageManager& manager, const std::string& depsers,
                                     int version, Json::Value& result) {
  if (depsers.empty()) return true;
  std::set<std::string> stopped =
      manager.checkServiceStarted(manager.getServiceSetFromString(depsers.c_str()));
  if (stopped.empty()) return true;
  if (stopped.count("pgsql")) {
    if (!VolumeListGet(result)) return false;
    result = Json::Value(Json::objectValue);
  }
  if (version == 1) {
    result["services"] =
        manager.checkServiceStarted(PackageManager::PMSExplodeServiceString(depsers.c_str()));
  } else {
    result["services"] = Json::Value(Json::arrayValue);
    for (const std::string& name : stopped) result["services"].append(name);
  }
  response->SetError(kErrServiceNotRunning, result);
  return false;
}

bool PackageWebAPI::CheckEnvDependencies(PackageManager& manager, const std::string& deppkgs,
                                         Json::Value& result) {
  DepPkgVector list;
  if (deppkgs.empty() || PMSParseDepJSONString(deppkgs, list) == 0) return true;
  std::string not_started;
  if (manager.arePackagesInstallAndStart(list, result["uninstall_packages"], not_started,
                                         nullptr)) {
    result.removeMember("uninstall_packages");
    return true;
  }
  result["unstart_packages"] = not_started;
  response->SetError(kErrDependencyMissing, result);
  return false;
}

bool PackageWebAPI::CheckEnvDependents(PackageManager& manager, const std::string& id,
                                       Json::Value& result) {
  if (id.empty()) return true;
  Json::Value list;
  if (manager.getDepPkgListStop(id, request->GetUILanguage().c_str(), list) != 0 ||
      request->GetParam("blCheckDep", "true").asString() != "true" || list.empty()) {
    return true;
  }
  std::string text;
  if (list.isArray()) {
    for (const Json::Value& entry : list) {
      if (!text.empty()) text += ", ";
      if (entry.isMember("name")) text += entry["name"].asString();
    }
  }
  result["packages"] = text;
  response->SetError(kErrDependentsRunning, result);
  return false;
}

}  // namespace KIVO_PACKAGE
