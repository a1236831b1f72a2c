// Images: the icons of installed and server packages, and their
// screenshots. These methods answer with the image file itself (a raw CGI
// answer) instead of JSON; icons fall back to the package center's own icon
// so that the desktop always gets an image.

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unistd.h>
#include <vector>

#include "error_codes.h"
#include "klibc/sysroot.h"
#include "log_line.h"
#include "package_webapi.h"
#include "pkgserver/server_image.h"
#include "pkgtool/pms.h"
#include "pkgtool/pms_image.h"
#include "webapi/http_file_outputer.h"

namespace KIVO_PACKAGE {
namespace {

constexpr size_t kPathBufferSize = 4096;
// A found image is cached by the browser for 30 days: its address names
// the package's version, so a new version gets a new address. A fallback is
// cached for seconds only, so a real image replaces it as soon as it exists.
constexpr int kFoundMaxAge = 2592000;
constexpr int kFallbackMaxAge = 10;

constexpr const char* kSmallIcon = "thumb_72.png";
constexpr const char* kLargeIcon = "thumb_256.png";

constexpr const char* kFallback72 = "%s/modules/PkgManApp/images/package_center_72.png";
constexpr const char* kFallback256 = "%s/modules/PkgManApp/images/package_center_256.png";
// The doubled extension is the server method's own fallback name.
constexpr const char* kServerFallback256 = "%s/modules/PkgManApp/images/package_center_256.png.png";

// Parameters of the image methods are read plainly; a value of the wrong
// JSON type reads as absent.
std::string TextParam(const APIRequest* request, const char* name) {
  Json::Value v = request->GetParam(name, "");
  return v.isString() ? v.asString() : "";
}

int IntParam(const APIRequest* request, const char* name) {
  Json::Value v = request->GetParam(name, "");
  return v.isInt() ? v.asInt() : 0;
}

void FallbackPath(const char* format, char* buffer) {
  std::string webman = KIVORootPath("/usr/kivo/kivoman/webman");
  snprintf(buffer, kPathBufferSize, format, webman.c_str());
}

Json::Value ImageError(const char* reason) {
  Json::Value data(Json::objectValue);
  data["reason"] = reason;
  return data;
}

}  // namespace

bool PackageWebAPI::DumpImage(const char* path, int max_age) {
  if (access(path, R_OK) != 0) return false;
  printf("Cache-Control: max-age=%d\r\n", max_age);
  // The lock only keeps a writer of the package tool from swapping the file
  // while it is sent; an image cannot wait for it, so a busy lock does not
  // stop the answer (an open file stays whole even when renamed over).
  int lock = PMSLockFile(path, 0);
  if (!HTTPFileOutputer::Output(path, "image/jpeg")) {
    PKG_LOG_ERR("cannot send %s", path);
  }
  if (lock >= 0) PMSUnlockFile(lock);
  fflush(stdout);
  exit(0);
}

bool PackageWebAPI::GetVXImage(const std::vector<int>& kinds, const char* file, char* buffer,
                               size_t size) {
  if (!file || !buffer || kinds.empty()) return false;
  std::string name = TextParam(request, "name");
  std::string ver = TextParam(request, "ver");
  for (int kind : kinds) {
    if (PMSGetInstallImage(kind, kPMSImageStoreInstalled, name.c_str(), ver.c_str(), file, buffer,
                           size)) {
      return true;
    }
  }
  return false;
}

bool PackageWebAPI::GetServerImage(std::string* path) {
  // "bls" (whether the entry is the vendor's or a feed's) is not needed:
  // the link names the image and the server it comes from.
  return KIVOPackageTool::PMSServerImagePath(TextParam(request, "name"), TextParam(request, "ver"),
                                             TextParam(request, "link"), path);
}

void PackageWebAPI::GetVXIcon() {
  char path[kPathBufferSize] = {};
  std::string name = TextParam(request, "name");
  std::string ver = name.empty() ? "" : TextParam(request, "ver");
  if (!name.empty() && !ver.empty()) {
    int size = IntParam(request, "size");
    bool found = false;
    if (size == 72) {
      found = PMSGetInstallImage(PKG_INFO_TYPE_ICON, kPMSImageStoreInstalled, name.c_str(),
                                 ver.c_str(), kSmallIcon, path, sizeof(path)) != 0;
    } else if (size == 128 || size == 144 || size == 256) {
      found =
          GetVXImage({PKG_INFO_TYPE_ICON_256, PKG_INFO_TYPE_ICON}, kLargeIcon, path, sizeof(path));
    }
    if (found) {
      response->SetEnableOutput(false);
      DumpImage(path, kFoundMaxAge);
    }
  }
  FallbackPath(IntParam(request, "size") == 72 ? kFallback72 : kFallback256, path);
  DumpImage(path, kFallbackMaxAge);
}

// A server package's icon is the image its link names, whatever the size
// asked: the desktop passes the catalogue's "icon" or "icon_256" as it needs.
void PackageWebAPI::GetServerIcon() {
  std::string found;
  if (GetServerImage(&found)) DumpImage(found.c_str(), kFoundMaxAge);
  char path[kPathBufferSize] = {};
  FallbackPath(IntParam(request, "size") == 72 ? kFallback72 : kServerFallback256, path);
  DumpImage(path, kFallbackMaxAge);
}

// Screenshots are asked for by package, version and number (1 to 8); a
// screenshot that is not there is a JSON error the desktop can show, since
// there is no sensible stand-in picture.
bool PackageWebAPI::ReadScreenshotRequest(std::string& file) {
  std::string name = TextParam(request, "name");
  std::string ver = TextParam(request, "ver");
  int index = IntParam(request, "index");
  file = "screenshot_" + std::to_string(index) + ".png";
  if (name.empty() || ver.empty() || PMSScreenshotIndex(file.c_str()) == 0) {
    Json::Value data(Json::objectValue);
    data["name"] = name.empty() ? "name" : ver.empty() ? "ver" : "index";
    data["reason"] = "condition";
    response->SetError(kErrBadParameter, data);
    return false;
  }
  return true;
}

void PackageWebAPI::GetVXScreenshot() {
  std::string file;
  if (!ReadScreenshotRequest(file)) return;
  char path[kPathBufferSize] = {};
  if (!GetVXImage({PKG_INFO_TYPE_SCREENSHOT}, file.c_str(), path, sizeof(path))) {
    return response->SetError(kErrImageNotFound, ImageError("no such screenshot"));
  }
  response->SetEnableOutput(false);
  DumpImage(path, kFoundMaxAge);
  // Only a file that vanished since it was found gets here.
  response->SetEnableOutput(true);
  response->SetError(kErrImageNotFound, ImageError("no such screenshot"));
}

void PackageWebAPI::GetServerScreenshot() {
  std::string file;
  if (!ReadScreenshotRequest(file)) return;
  std::string path;
  if (!GetServerImage(&path)) {
    return response->SetError(kErrImageNotFound, ImageError("screenshot not available"));
  }
  DumpImage(path.c_str(), kFoundMaxAge);
  response->SetError(kErrImageNotFound, ImageError("screenshot not available"));
}

}  // namespace KIVO_PACKAGE
