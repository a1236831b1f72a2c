// The web API modules the host serves, loaded with dlopen from the modules
// folder, and the lookup of a request's row in their tables.
#pragma once

#include <string>
#include <vector>

#include "webapi/api_table.h"

enum class RouteResult { Found, UnknownAPI, UnknownMethod, UnsupportedVersion };

struct Route {
  WebAPIHandler handler = nullptr;
  WebAPIChecker checker = nullptr;  // null: the row has no checker
};

struct APIVersionRange {
  std::string api;
  int min_version;
  int max_version;
};

class ModuleTable {
 public:
  // Loads every "*.so" of `dir` (in name order) that exports GetAPITable.
  // Modules that cannot be loaded are logged and skipped.
  explicit ModuleTable(const std::string& dir);
  ModuleTable(const ModuleTable&) = delete;
  ModuleTable& operator=(const ModuleTable&) = delete;

  RouteResult Find(const std::string& api, const std::string& method, int version,
                   Route* route) const;
  // Every API with the lowest and highest version any of its rows serves.
  std::vector<APIVersionRange> Versions() const;

 private:
  struct Module {
    const WEBAPI_TABLE_ROW* table;
    const WEBAPI_CHECK_ROW* checks;  // may be null
  };
  WebAPIChecker FindChecker(const Module& module, const std::string& api, const std::string& method,
                            int version) const;

  std::vector<Module> modules_;
};

// The folder the modules are loaded from: $KIVO_MODULE_DIR, or
// "<folder of this program>/../lib/kivo/modules".
std::string DefaultModuleDir();
