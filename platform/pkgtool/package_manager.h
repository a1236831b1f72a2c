// PackageManager: the package tool's view of the installed packages, used by
// the web API module once per request. Cheap to construct; call init() first.
//
// Every call records a result code (result_codes.h) that getResult() answers
// until the next call.
#pragma once

#include <string>

class PackageManager {
 public:
  PackageManager() = default;
  PackageManager(const PackageManager&) = delete;
  PackageManager& operator=(const PackageManager&) = delete;

  // Makes sure the registry can be read (creating its folder on a fresh
  // system). False, with result 263, when it cannot.
  bool init();

  // The last result code.
  int getResult() const { return result_; }

  // The path of the package's own log file, as its INFO declares it ("logfile",
  // relative to the package's data folder). With `evenIfMissing` false (the
  // one-argument form) the path is given only when the file exists; with true,
  // also when the package has not written it yet. Empty when the package is
  // unknown (result 255), declares no log or declares a path that leaves its
  // data folder (result 0).
  std::string getPackageLog(const std::string& id) { return getPackageLog(id, false); }
  std::string getPackageLog(const std::string& id, bool evenIfMissing);

 private:
  int result_ = 0;
};

// The whole text of a package log file; when the file is larger than 1 MiB,
// its last 1 MiB (the recent lines are the ones worth reading). Empty when the
// file cannot be read.
std::string PMSReadPackageLog(const std::string& path);
