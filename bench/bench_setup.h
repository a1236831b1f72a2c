// Setting up a benchmark either works or ends the program: figures measured
// on a half-made root would mislead whoever reads them.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>

#include "klibc/atomic_file.h"

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
