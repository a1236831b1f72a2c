// Setting up a benchmark either works or ends the program: figures measured
// on a half-made root would mislead whoever reads them.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_manager.h"

inline void Require(bool ok, const std::string& what) {
  if (ok) return;
  fprintf(stderr, "benchmark setup failed: %s\n", what.c_str());
  exit(1);
}

inline void MakeDirOrExit(const std::string& path) {
  Require(KIVOFSMkdirP(path.c_str()) == 0, "mkdir " + path);
}

inline void WriteOrExit(const std::string& path, const std::string& content) {
  Require(KIVOWriteFileAtomic(path, content, SyncToDisk::No), "write " + path);
}

// Installs package file `file` with the package tool (no start) and removes
// the file.
inline void InstallOrExit(const std::string& file) {
  std::string message;
  PKG_ERRCODE code;
  Json::Value details;
  Require(InstallPackageFileImpl("root", file, "", 0, "", false, "enu", message, code, details,
                                 true, false),
          "install of " + file + ": " + message);
  unlink(file.c_str());
}
