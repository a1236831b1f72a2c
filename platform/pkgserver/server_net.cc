#include "pkgserver/server_net.h"

#include <dlfcn.h>

namespace {

constexpr char kLibrary[] = "libkivo_pkgserver_net.so";

// The transfer library sits beside this one.
std::string SiblingLibrary() {
  Dl_info info;
  if (!dladdr(reinterpret_cast<void*>(&PMSServerNetOps), &info) || !info.dli_fname) return kLibrary;
  std::string self = info.dli_fname;
  size_t slash = self.rfind('/');
  return slash == std::string::npos ? kLibrary : self.substr(0, slash + 1) + kLibrary;
}

}  // namespace

const PackageServerNetOps* PMSServerNetOps(std::string* error) {
  // Kept for the life of the process: the table points into the library.
  static std::string load_error;
  static const PackageServerNetOps* ops = []() -> const PackageServerNetOps* {
    void* handle = dlopen(SiblingLibrary().c_str(), RTLD_NOW | RTLD_LOCAL);
    if (!handle) {
      load_error = dlerror();
      return nullptr;
    }
    auto get = reinterpret_cast<KivoPackageServerNetFn>(dlsym(handle, "KivoPackageServerNet"));
    if (!get) load_error = std::string("no KivoPackageServerNet in ") + kLibrary;
    return get ? get() : nullptr;
  }();
  if (!ops) *error = load_error.empty() ? std::string("cannot load ") + kLibrary : load_error;
  return ops;
}

bool PMSServerFetch(const HttpLimits& limits, HttpFetch& fetch) {
  const PackageServerNetOps* net = PMSServerNetOps(&fetch.error);
  return net && net->fetch(limits, fetch);
}
