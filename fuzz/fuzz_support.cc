#include "fuzz_support.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <dirent.h>
#include <sys/mman.h>
#include <unistd.h>
#include <vector>

#include <ftw.h>

void FuzzRequire(bool ok, const char* what) {
  if (ok) return;
  fprintf(stderr, "fuzz: contract broken: %s\n", what);
  abort();
}

int FuzzMemoryFile(const uint8_t* data, size_t size) {
  int fd = memfd_create("fuzz-input", MFD_CLOEXEC);
  FuzzRequire(fd >= 0, "memfd_create failed");
  size_t done = 0;
  while (done < size) {
    ssize_t n = write(fd, data + done, size - done);
    FuzzRequire(n > 0, "cannot write the input to a memory file");
    done += static_cast<size_t>(n);
  }
  FuzzRequire(lseek(fd, 0, SEEK_SET) == 0, "cannot rewind the memory file");
  return fd;
}

std::string FuzzFdPath(int fd) { return "/proc/self/fd/" + std::to_string(fd); }

namespace {

int RemoveOne(const char* path, const struct stat*, int, struct FTW*) { return remove(path); }

// nftw passes no user data, and FuzzCountFiles is the only caller.
thread_local int files_seen = 0;

int CountOne(const char*, const struct stat*, int type, struct FTW*) {
  if (type != FTW_D && type != FTW_DP && type != FTW_DNR) ++files_seen;
  return 0;
}

// The scratch folders this process made, removed at a normal exit. Only
// written while a target initialises, before libFuzzer runs any input.
std::vector<std::string>& ScratchFolders() {
  static std::vector<std::string> folders;
  return folders;
}

void RemoveScratchFolders() {
  for (const std::string& dir : ScratchFolders()) FuzzRemoveTree(dir);
}

}  // namespace

bool FuzzRemoveTree(const std::string& path) {
  if (path.empty() || path == "/") return false;
  nftw(path.c_str(), RemoveOne, 16, FTW_DEPTH | FTW_PHYS);
  return access(path.c_str(), F_OK) != 0;
}

std::string FuzzScratchFolder(const char* tag) {
  const char* tmp = getenv("TMPDIR");
  std::string pattern = std::string(tmp && *tmp ? tmp : "/tmp") + "/kivo-fuzz-" + tag + "-XXXXXX";
  FuzzRequire(mkdtemp(&pattern[0]) != nullptr, "cannot make a scratch folder");
  if (ScratchFolders().empty()) atexit(RemoveScratchFolders);
  ScratchFolders().push_back(pattern);
  return pattern;
}

std::string FuzzListFolder(const std::string& dir) {
  std::vector<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* e = readdir(d)) {
      std::string name = e->d_name;
      if (name != "." && name != "..") names.push_back(name);
    }
    closedir(d);
  }
  std::sort(names.begin(), names.end());
  std::string list;
  for (const std::string& name : names) list += (list.empty() ? "" : " ") + name;
  return list;
}

int FuzzCountFiles(const std::string& dir) {
  files_seen = 0;
  nftw(dir.c_str(), CountOne, 16, FTW_PHYS);
  return files_seen;
}
