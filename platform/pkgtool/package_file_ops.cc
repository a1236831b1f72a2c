#include "pkgtool/package_file_ops.h"

#include <dlfcn.h>

#include "pkgtool/package_manager.h"

namespace {

// libkivo_pkgfile.so sits beside this library.
std::string SiblingLibrary() {
  Dl_info info;
  if (!dladdr(reinterpret_cast<void*>(&PMSPackageFileOps), &info) || !info.dli_fname) {
    return "libkivo_pkgfile.so";
  }
  std::string self = info.dli_fname;
  size_t slash = self.rfind('/');
  return slash == std::string::npos ? "libkivo_pkgfile.so"
                                    : self.substr(0, slash) + "/libkivo_pkgfile.so";
}

}  // namespace

const PackageFileOps* PMSPackageFileOps(std::string* error) {
  // Loaded once per process and kept: the table points into the library.
  static const PackageFileOps* ops = [error]() -> const PackageFileOps* {
    void* handle = dlopen(SiblingLibrary().c_str(), RTLD_NOW | RTLD_LOCAL);
    if (!handle) {
      *error = dlerror();
      return nullptr;
    }
    auto get = reinterpret_cast<KivoPackageFileOpsFn>(dlsym(handle, "KivoPackageFileOps"));
    return get ? get() : nullptr;
  }();
  if (!ops && error->empty()) *error = "cannot load libkivo_pkgfile.so";
  return ops;
}

bool PackageManager::queryPackageFileInfo(const std::string& path, PackageInfo& info,
                                          PKG_INSTALLATION_TYPE, const char* language) {
  std::string error;
  const PackageFileOps* ops = PMSPackageFileOps(&error);
  result_ = ops ? ops->query(path, info, false, language) : PKG_ERR_INTERNAL;
  return result_ == PKG_OK;
}

bool PackageManager::queryPackageFileInfoWithWizard(const std::string& path, PackageInfo& info,
                                                    PKG_INSTALLATION_TYPE, const char* language) {
  std::string error;
  const PackageFileOps* ops = PMSPackageFileOps(&error);
  result_ = ops ? ops->query(path, info, true, language) : PKG_ERR_INTERNAL;
  return result_ == PKG_OK;
}

bool CheckPackageFileInfoImpl(const char* language, const std::string& path, std::string& message,
                              PKG_ERRCODE& code, Json::Value& details, PackageInfo& info) {
  const PackageFileOps* ops = PMSPackageFileOps(&message);
  if (!ops) {
    code = PKG_ERR_INTERNAL;
    return false;
  }
  return ops->check(language, path, message, code, details, info);
}

bool InstallPackageFileImpl(const std::string& user, const std::string& path,
                            const std::string& volume, int reserved, const std::string& extraValues,
                            bool typeFlag, const std::string& language, std::string& message,
                            PKG_ERRCODE& code, Json::Value& details, bool force, bool checkCodesign,
                            const PMSInstallSource* source) {
  const PackageFileOps* ops = PMSPackageFileOps(&message);
  if (!ops) {
    code = PKG_ERR_INTERNAL;
    return false;
  }
  return ops->install(user, path, volume, reserved, extraValues, typeFlag, language, message, code,
                      details, force, checkCodesign, source);
}
