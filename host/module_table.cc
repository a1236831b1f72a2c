#include "host/module_table.h"

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <dlfcn.h>
#include <map>
#include <syslog.h>
#include <unistd.h>

namespace {

std::vector<std::string> ModuleFiles(const std::string& dir) {
  std::vector<std::string> files;
  DIR* d = opendir(dir.c_str());
  if (!d) return files;
  while (struct dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name.size() > 3 && name.compare(name.size() - 3, 3, ".so") == 0) files.push_back(name);
  }
  closedir(d);
  std::sort(files.begin(), files.end());
  return files;
}

}  // namespace

std::string DefaultModuleDir() {
  if (const char* env = getenv("KIVO_MODULE_DIR")) return env;
  char exe[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
  if (n <= 0) return "/usr/lib/kivo/modules";
  exe[n] = '\0';
  std::string dir(exe);
  return dir.substr(0, dir.rfind('/')) + "/../lib/kivo/modules";
}

ModuleTable::ModuleTable(const std::string& dir) {
  for (const std::string& file : ModuleFiles(dir)) {
    std::string path = dir + "/" + file;
    // The module stays loaded until the process ends: its tables and handlers
    // are used to the last moment of the request.
    void* handle = dlopen(path.c_str(), RTLD_LAZY | RTLD_LOCAL);
    if (!handle) {
      syslog(LOG_ERR, "%s:%d cannot load module %s: %s", "module_table", __LINE__, path.c_str(),
             dlerror());
      continue;
    }
    auto get_table = reinterpret_cast<GetAPITableFn>(dlsym(handle, "GetAPITable"));
    auto get_checks = reinterpret_cast<GetAPICheckTableFn>(dlsym(handle, "GetAPICheckTable"));
    if (!get_table) {
      syslog(LOG_ERR, "%s:%d module %s exports no GetAPITable", "module_table", __LINE__,
             path.c_str());
      continue;
    }
    modules_.push_back(Module{get_table(), get_checks ? get_checks() : nullptr});
  }
}

RouteResult ModuleTable::Find(const std::string& api, const std::string& method, int version,
                              Route* route) const {
  RouteResult result = RouteResult::UnknownAPI;
  for (const Module& m : modules_) {
    for (const WEBAPI_TABLE_ROW* row = m.table; row->api; ++row) {
      if (api != row->api) continue;
      if (result == RouteResult::UnknownAPI) result = RouteResult::UnknownMethod;
      if (method != row->method) continue;
      result = RouteResult::UnsupportedVersion;
      if (version != row->version) continue;
      route->handler = row->handler;
      route->checker = FindChecker(m, api, method, version);
      return RouteResult::Found;
    }
  }
  return result;
}

WebAPIChecker ModuleTable::FindChecker(const Module& module, const std::string& api,
                                       const std::string& method, int version) const {
  if (!module.checks) return nullptr;
  for (const WEBAPI_CHECK_ROW* row = module.checks; row->api; ++row) {
    if (api == row->api && method == row->method && version == row->version) return row->checker;
  }
  return nullptr;
}

std::vector<APIVersionRange> ModuleTable::Versions() const {
  std::map<std::string, APIVersionRange> ranges;
  for (const Module& m : modules_) {
    for (const WEBAPI_TABLE_ROW* row = m.table; row->api; ++row) {
      auto it = ranges.find(row->api);
      if (it == ranges.end()) {
        ranges[row->api] = APIVersionRange{row->api, row->version, row->version};
      } else {
        it->second.min_version = std::min(it->second.min_version, row->version);
        it->second.max_version = std::max(it->second.max_version, row->version);
      }
    }
  }
  std::vector<APIVersionRange> out;
  for (auto& entry : ranges) out.push_back(entry.second);
  return out;
}
