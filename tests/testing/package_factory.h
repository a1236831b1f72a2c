// Package files for tests, built by the project's own builder from sources
// the test describes: INFO keys, scripts, payload files, wizards.
#pragma once

#include <map>
#include <string>
#include <sys/types.h>
#include <utility>
#include <vector>

struct TestPackage {
  std::string id = "test-app";
  std::string version = "1.0";
  std::map<std::string, std::string> info;     // further INFO keys
  std::map<std::string, std::string> scripts;  // name -> shell body (after #!/bin/sh)
  std::map<std::string, std::string> files;    // payload path -> content
  std::map<std::string, std::string> members;  // other members (WIZARD_UIFILES/..., LICENSE)
  bool daemon = true;                          // a service tracked by a pid file

  // Builds it into `dir` and returns the package file's path.
  std::string Build(const std::string& dir) const;
};

// A package `id` whose INFO adds `info`, for a test where only those keys matter.
TestPackage PackageWithInfo(const std::string& id,
                            const std::map<std::string, std::string>& info = {});

// A package whose payload is written entry by entry with libarchive, so a
// test can put in what the builder never would (escaping paths, devices,
// hard links, setuid files). Entries: {path, type, mode, link target}.
struct RawEntry {
  std::string path;
  char type;  // 'f' file, 'd' folder, 'l' symlink, 'h' hard link, 'c' character device
  unsigned mode;
  std::string target;
};
std::string BuildRawPackage(const std::string& dir, const std::string& id,
                            const std::vector<RawEntry>& entries);
// Writes just such a payload (a tar.gz) to `path`.
void WriteRawPayload(const std::string& path, const std::vector<RawEntry>& entries);

// A package file's outer archive as written: members in order, names and
// contents exactly as given, so a test can write what no builder would
// (two members of one name, a member after the payload). `Manifest` makes
// the MANIFEST text listing the members given, in that order.
using MemberList = std::vector<std::pair<std::string, std::string>>;
void WriteRawPackageFile(const std::string& path, const MemberList& members);
std::string Manifest(const MemberList& members);

// Runs a program and returns its exit status; stdout and stderr into *out.
int RunProgram(const std::vector<std::string>& argv, std::string* out,
               const std::map<std::string, std::string>& extra_env = {});
// Kills each of `pids` (SIGKILL) and reaps it: for processes a test forked.
void KillAndReap(const std::vector<pid_t>& pids);
// Runs build/bin/kivoctl with `args` in the current KIVO_ROOT.
int Kivoctl(const std::vector<std::string>& args, std::string* out = nullptr,
            const std::map<std::string, std::string>& extra_env = {});
// Stops every installed package, so that no package's daemon outlives the
// test that started it.
void StopInstalledPackages();
