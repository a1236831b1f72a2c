#include "pkgtool/pms_image.h"

#include <cstring>
#include <string>
#include <unistd.h>

#include "pkgtool/registry.h"
#include "pkgtool/version.h"

namespace {

constexpr int kMaxScreenshots = 8;

// A plain file name: no folder, no NUL (the caller's C string ends there),
// not "." or "..".
bool IsPlainName(const std::string& name) {
  return !name.empty() && name.size() <= 255 && name.find('/') == std::string::npos &&
         name != "." && name != "..";
}

// The registry member that holds `kind` asked as `file`; "" when none.
std::string MemberOf(int kind, const std::string& file) {
  switch (kind) {
    case PKG_INFO_TYPE_ICON:
      return "PACKAGE_ICON.PNG";
    case PKG_INFO_TYPE_ICON_256:
      return "PACKAGE_ICON_256.PNG";
    case PKG_INFO_TYPE_SCREENSHOT: {
      int index = PMSScreenshotIndex(file.c_str());
      return index > 0 ? "SCREENSHOT_" + std::to_string(index) + ".PNG" : "";
    }
    default:
      return "";
  }
}

bool InstalledAt(const std::string& package, const std::string& version) {
  KeyValueMap info;
  if (!PackageRegistry::ReadInfo(package, &info)) return false;
  auto it = info.find("version");
  return it != info.end() && it->second == version;
}

}  // namespace

int PMSScreenshotIndex(const char* file) {
  static const char kPrefix[] = "screenshot_";
  static const char kSuffix[] = ".png";
  if (file == nullptr) return 0;
  std::string name(file);
  if (name.size() != sizeof(kPrefix) - 1 + 1 + sizeof(kSuffix) - 1) return 0;
  if (name.compare(0, sizeof(kPrefix) - 1, kPrefix) != 0) return 0;
  if (name.compare(name.size() - (sizeof(kSuffix) - 1), std::string::npos, kSuffix) != 0) return 0;
  char digit = name[sizeof(kPrefix) - 1];
  return digit >= '1' && digit <= '0' + kMaxScreenshots ? digit - '0' : 0;
}

int PMSGetInstallImage(int kind, const char* store, const char* package, const char* version,
                       const char* file, char* buffer, size_t size) {
  if (!store || !package || !version || !file || !buffer || size == 0) return 0;
  if (strcmp(store, kPMSImageStoreInstalled) != 0) return 0;
  if (!PMSIsValidPackageId(package) || !PMSIsValidVersion(version) || !IsPlainName(file)) return 0;
  std::string member = MemberOf(kind, file);
  if (member.empty() || !InstalledAt(package, version)) return 0;
  std::string path = PackageRegistry::RecordDir(package) + "/" + member;
  if (access(path.c_str(), R_OK) != 0 || path.size() >= size) return 0;
  memcpy(buffer, path.c_str(), path.size() + 1);
  return 1;
}
