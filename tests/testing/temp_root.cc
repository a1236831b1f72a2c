#include "testing/temp_root.h"

#include <dirent.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "accounts/accounts.h"
#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "pkgtool/package_cgroup.h"
#include "tools/kivoctl/root_setup.h"

#include <stdlib.h>

int CountEntries(const std::string& dir, const std::string& prefix) {
  int n = 0;
  if (DIR* d = opendir(dir.c_str())) {
    while (dirent* e = readdir(d)) n += std::string(e->d_name).rfind(prefix, 0) == 0;
    closedir(d);
  }
  return n;
}

DataCopies ListDataCopies(const std::string& snapshots_dir) {
  DataCopies copies;
  const std::string kept = ".kept";
  DIR* d = opendir(snapshots_dir.c_str());
  if (!d) return copies;
  while (dirent* e = readdir(d)) {
    const std::string id = e->d_name;
    if (id == "." || id == "..") continue;
    DIR* inner = opendir((snapshots_dir + "/" + id).c_str());
    if (!inner) {
      copies.entries.push_back(id);
      continue;
    }
    while (dirent* c = readdir(inner)) {
      const std::string name = c->d_name;
      if (name == "." || name == "..") continue;
      copies.entries.push_back(id + "/" + name);
      copies.kept += name.size() > kept.size() &&
                     name.compare(name.size() - kept.size(), kept.size(), kept) == 0;
    }
    closedir(inner);
  }
  closedir(d);
  return copies;
}

std::string FileText(const std::string& path) {
  std::string text;
  return KIVOReadFile(path, &text) ? text : "";
}

std::string BuildDir() {
  const char* dir = getenv("KIVO_BUILD_DIR");
  return dir ? dir : ".";
}

void UseBuildDirOfThisProgram() {
  char exe[4096];
  ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
  std::string path(exe, n > 0 ? static_cast<size_t>(n) : 0);
  setenv("KIVO_BUILD_DIR", (path.substr(0, path.rfind('/')) + "/..").c_str(), 0);
}

TempRoot::TempRoot() {
  const char* tmp = getenv("TMPDIR");
  std::string pattern = std::string(tmp ? tmp : "/tmp") + "/kivo-root-XXXXXX";
  char* made = mkdtemp(&pattern[0]);
  if (!made) abort();
  dir_ = made;
  std::string error;
  if (!KIVOCreateSystemRoot(dir_, &error)) ADD_FAILURE() << error;
  setenv("KIVO_ROOT", dir_.c_str(), 1);
}

// A worker a test's request forked (a download that failed, a clean-up)
// may still be writing its last files under the root as the test ends: the
// removal is tried again until the root is gone, for up to five seconds.
TempRoot::~TempRoot() {
  // The kernel keeps the packages' control groups whatever happens to the
  // root's files: they go with the root, with what still runs in them.
  std::string problem;
  EXPECT_TRUE(PackageCgroupRemoveRoot(dir_, &problem)) << problem;
  int status = -1;
  for (int attempt = 0; attempt < 100; ++attempt) {
    status = KLIBCExec("/bin/rm", "-rf", dir_.c_str(), nullptr, nullptr);
    if (status == 0 && access(dir_.c_str(), F_OK) != 0) return;
    usleep(50 * 1000);
  }
  ADD_FAILURE() << dir_ << " could not be removed (rm: " << status << ")";
}

void TempRoot::Write(const std::string& fixed, const std::string& content) const {
  std::string path = Path(fixed);
  ASSERT_EQ(0, KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str())) << path;
  ASSERT_TRUE(KIVOWriteFileAtomic(path, content, SyncToDisk::No)) << path;
}

void TempRoot::AddAccount(const std::string& name, const std::string& password,
                          const std::vector<std::string>& groups) const {
  std::string error;
  ASSERT_TRUE(KIVOAccountSet(name, password, groups, &error)) << error;
}
