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
constexpr const char* kSourceVendor = "AVAIL/KIVO";
constexpr const char* kSourceOther = "AVAIL/OTHER";

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

bool BoolParam(const APIRequest* request, const char* name) {
  Json::Value v = request->GetParam(name, "");
  return v.isBool() && v.asBool();
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

bool PackageWebAPI::GetServerImage(const std::vector<std::string>& files, char* buffer,
                                   size_t size) {
  if (!buffer || files.empty()) return false;
  const char* source = BoolParam(request, "bls") ? kSourceVendor : kSourceOther;
  std::string name = TextParam(request, "name");
  std::string ver = TextParam(request, "ver");
  std::string link = TextParam(request, "link");
  for (size_t i = 0; i < files.size(); ++i) {
    // Only the first choice is fetched; later ones are taken from the cache
    // alone, since the link names the first one's image.
    const char* link_or_none = i == 0 && !link.empty() ? link.c_str() : nullptr;
    if (KIVOPackageTool::PMSGetServerImage(source, name.c_str(), ver.c_str(), files[i].c_str(),
                                           link_or_none, buffer, size)) {
      return true;
    }
  }
  return false;
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

void PackageWebAPI::GetServerIcon() {
  char path[kPathBufferSize] = {};
  std::string name = TextParam(request, "name");
  std::string ver = name.empty() ? "" : TextParam(request, "ver");
  int size = IntParam(request, "size");
  if (!name.empty() && !ver.empty()) {
    bool large = size == 96 || size == 128 || size == 144 || size == 256;
    std::vector<std::string> files = large ? std::vector<std::string>{kLargeIcon, kSmallIcon}
                                           : std::vector<std::string>{kSmallIcon};
    if (GetServerImage(files, path, sizeof(path))) DumpImage(path, kFoundMaxAge);
  }
  FallbackPath(size == 72 ? kFallback72 : kServerFallback256, path);
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
  char path[kPathBufferSize] = {};
  if (!GetServerImage({file}, path, sizeof(path))) {
    return response->SetError(kErrImageNotFound, ImageError("screenshot not available"));
  }
  DumpImage(path, kFoundMaxAge);
  response->SetError(kErrImageNotFound, ImageError("screenshot not available"));
}

}  // namespace KIVO_PACKAGE
