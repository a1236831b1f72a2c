#include "host/scgi_preload.h"

#include <algorithm>
#include <dirent.h>
#include <dlfcn.h>
#include <initializer_list>

namespace {

void Load(const std::string& file, std::vector<std::string>* failures) {
  // Bound now: the binding is done once here instead of lazily in each child,
  // whose copy of the binding tables is thrown away with it.
  if (!dlopen(file.c_str(), RTLD_NOW | RTLD_LOCAL)) {
    const char* why = dlerror();
    failures->push_back(file + ": " + (why ? why : "cannot be loaded"));
  }
}

std::vector<std::string> SharedObjects(const std::string& dir) {
  std::vector<std::string> files;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d)) {
      std::string name = e->d_name;
      if (name.size() > 3 && name.compare(name.size() - 3, 3, ".so") == 0)
        files.push_back(dir + "/" + name);
    }
    closedir(d);
  }
  std::sort(files.begin(), files.end());
  return files;
}

}  // namespace

std::vector<std::string> PreloadRequestLibraries(const std::string& module_dir) {
  std::vector<std::string> failures;
  for (const std::string& module : SharedObjects(module_dir)) Load(module, &failures);
  // The platform's libraries lie two folders above the modules, as the
  // request code finds them.
  const std::string lib = module_dir + "/../..";
  for (const char* name :
       {"libkivo_pkgfile.so", "libkivo_multipart.so", "libkivo_pkgserver_net.so"})
    Load(lib + "/" + name, &failures);
  for (const char* name : {"libcrypt.so.1", "libsqlite3.so.0"}) Load(name, &failures);
  return failures;
}
