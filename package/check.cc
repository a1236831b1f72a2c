// The feasibility check: may an install, uninstall or stop go ahead?

#include <map>
#include <string>

#include "error_codes.h"
#include "feasibility/feasibility_check.h"
#include "klibc/last_error.h"
#include "log_line.h"
#include "package_webapi.h"
#include "request_values.h"

namespace KIVO_PACKAGE {

namespace {

// Asks the feasibility library once; appends its reasons to `reasons`.
// True when the operation is allowed.
bool RunCheck(int type, int check_type, const std::string& packages, Json::Value& reasons) {
  PKLIBSZLIST list = KLIBCSzListAlloc(512);
  if (!list) {
    PKG_LOG_ERR("Failed to alloc list [0x%04X %s:%d]", KLIBCErrGet(), KLIBCErrorGetFile(),
                KLIBCErrorGetLine());
    return false;
  }
  int result = KIVOFeasibilityCheck(type, check_type, &list, packages.c_str(), 0);
  if (result < 0) {
    PKG_LOG_ERR("Feasibility check (type=0x%02x, check_type=0x%02x) failed [0x%04X %s:%d]", type,
                check_type, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
  } else if (result > 0) {
    for (int i = 0; i < list->nItem(); ++i) reasons.append(KLIBCSzListGet(list, i));
  }
  KLIBCSzListFree(list);
  return result == 0;
}

}  // namespace

void PackageWebAPI::FeasibilityCheck() {
  std::map<std::string, int> types = {{"install_check", KIVO_FEASIBILITY_INSTALL},
                                      {"uninstall_check", KIVO_FEASIBILITY_UNINSTALL},
                                      {"stop_check", KIVO_FEASIBILITY_STOP}};
  const std::string type = request->GetParam("type", "").asString();
  const Json::Value packages = request->GetParam("packages", Json::Value(Json::arrayValue));
  // The names go to the library as one comma-joined C string: each is a
  // whole package id, so none can carry a separator or a NUL into it.
  if (packages.empty() || !packages.isArray() || !AreIdsOrEmpty(packages)) {
    response->SetError(kErrBadParameter, Json::Value());
    return;
  }
  std::string joined;
  for (const Json::Value& id : packages) joined += (joined.empty() ? "" : ",") + id.asString();
  const struct {
    int check_type;
    const char* name;
  } kChecks[] = {{KIVO_FEASIBILITY_HARD, "hard"}, {KIVO_FEASIBILITY_SOFT, "soft"}};
  for (const auto& check : kChecks) {
    Json::Value reasons(Json::arrayValue);
    // An unknown name maps to 0, which the library answers for itself.
    if (!RunCheck(types[type], check.check_type, joined, reasons)) {
      Json::Value data(Json::objectValue);
      data["reasons"] = reasons;
      data["check_type"] = check.name;
      response->SetError(kErrNotFeasible, data);
      return;
    }
  }
  response->SetSuccess(Json::Value());
}

}  // namespace KIVO_PACKAGE
