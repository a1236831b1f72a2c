// The package tool's work on package files (reading, checking, installing)
// lives in libkivo_pkgfile.so with the archive, signature and hash libraries
// it needs. Most web API requests never touch a package file, and each
// request is a new process, so libkivo_pkgtool.so loads that library only
// when one of these operations is first called (package_file_ops.cc).
#pragma once

#include <string>

#include <json/value.h>

#include "pkgtool/package_info.h"
#include "pkgtool/package_origin.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/signature.h"

// The table libkivo_pkgfile.so exports as KivoPackageFileOps().
struct PackageFileOps {
  // queryPackageFileInfo(WithWizard): reads a package file's record. Returns
  // the result code; 289 (a member does not match MANIFEST) still fills
  // `info` when INFO could be read.
  int (*query)(const std::string& path, PackageInfo& info, bool with_wizard, const char* language);
  bool (*check)(const char* language, const std::string& path, std::string& message,
                PKG_ERRCODE& code, Json::Value& details, PackageInfo& info);
  bool (*install)(const std::string& user, const std::string& path, const std::string& volume,
                  int reserved, const std::string& extra_values, bool type_flag,
                  const std::string& language, std::string& message, PKG_ERRCODE& code,
                  Json::Value& details, bool force, bool check_codesign,
                  const PMSInstallSource* source);
};

extern "C" {
using KivoPackageFileOpsFn = const PackageFileOps* (*)();
}

// The loaded table, or null (with `*error` set) when the library cannot be
// loaded.
const PackageFileOps* PMSPackageFileOps(std::string* error);
