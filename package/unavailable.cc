// Members whose methods this build does not serve yet. Each answers a clear
// error instead of inventing data; a member moves to its area's source when
// it is built.

#include "error_codes.h"
#include "log_line.h"
#include "package_webapi.h"

namespace KIVO_PACKAGE {

void PackageWebAPI::AnswerNotAvailable(const char* member) {
  Json::Value data(Json::objectValue);
  data["reason"] = "not_available";
  data["message"] = request->GetAPIClass() + " " + request->GetAPIMethod() +
                    " is not available in this build yet";
  PKG_LOG_ERR("%s: %s is not available yet", request->GetAPIClass().c_str(), member);
  response->SetError(kErrFailed, data);
}

#define KIVO_NOT_AVAILABLE(name) \
  void PackageWebAPI::name() { AnswerNotAvailable(#name); }

}  // namespace KIVO_PACKAGE
