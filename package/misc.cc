// Package logs, and deletion of temporary files.

#include <limits.h>

#include "error_codes.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "log_line.h"
#include "package_webapi.h"
#include "request_values.h"
#include "storage/volume_lookup.h"

#include <stdlib.h>

namespace KIVO_PACKAGE {

void PackageWebAPI::GetLog() {
  // The package tool checks the whole name against the id rule before it
  // makes a path of it; an unknown or malformed name has no log.
  const std::string name = request->GetParam("name", "").asString();
  PackageManager manager;
  if (!manager.init()) {
    response->SetError(kErrFailed, Json::Value());
    return;
  }
  Json::Value result(Json::objectValue);
  result["pkglog"] = "";
  const std::string path = manager.getPackageLog(name);
  if (!path.empty()) result["pkglog"] = PMSReadPackageLog(path);
  response->SetSuccess(result);
}

}  // namespace KIVO_PACKAGE

namespace KIVO_PACKAGE {

namespace {

std::string RealPath(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? buf : "";
}

// True when `path` lies strictly inside `dir` with a name after the separator.
bool StrictlyInside(const std::string& path, const std::string& dir) {
  return !dir.empty() && path.size() > dir.size() + 1 && path.compare(0, dir.size(), dir) == 0 &&
         path[dir.size()] == '/';
}

}  // namespace

bool PackageWebAPI::DeleteTmpFile(const char* path) {
  if (!path || !*path) return false;
  // The folder is resolved (symlinks and "..") but not the last name, so a
  // symlink is removed as a link and never followed out of the folder.
  std::string given(path);
  size_t slash = given.rfind('/');
  std::string name = slash == std::string::npos ? given : given.substr(slash + 1);
  std::string folder =
      RealPath(slash == std::string::npos ? "." : (slash == 0 ? "/" : given.substr(0, slash)));
  if (folder.empty() || name.empty() || name == "." || name == "..") {
    PKG_LOG_ERR("[%s] is not a legal path point to a tmp directory", path);
    return false;
  }
  const std::string canonical = (folder == "/" ? "" : folder) + "/" + name;
  const std::string root_tmp = RealPath(KIVORootPath("/tmp"));
  if (!StrictlyInside(canonical, root_tmp)) {
    char share_tmp[4095] = {0};
    if (KIVOShareTmpPathGet(canonical.c_str(), share_tmp, sizeof(share_tmp)) < 0) {
      PKG_LOG_ERR("Fail to get share temp path from [%s]", path);
      return false;
    }
    std::string dir = RealPath(share_tmp);
    if (dir.empty() || canonical.compare(0, dir.size(), dir) != 0 ||
        (canonical.size() > dir.size() && canonical[dir.size()] != '/')) {
      PKG_LOG_ERR("[%s] is not a legal path point to a tmp directory", path);
      return false;
    }
    if (canonical.size() <= dir.size() + 1) {
      PKG_LOG_ERR("[%s] does not contain a file name", path);
      return false;
    }
  }
  // Checked: the removal itself may take long, so a child does it.
  pid_t child = KLIBCProcFork();
  if (child > 0) return true;
  return KLIBCExec("/bin/rm", "-rf", canonical.c_str(), nullptr, nullptr) == 0;
}

void PackageWebAPI::DeleteTmp() {
  const std::string path = request->GetParam("path", "").asString();
  // Checked whole: a path cut short at a NUL would name another file.
  if (IsCleanText(path) && DeleteTmpFile(path.c_str())) {
    response->SetSuccess();
  } else {
    response->SetError(kErrFailed, Json::Value());
  }
}

}  // namespace KIVO_PACKAGE
