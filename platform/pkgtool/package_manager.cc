#include "pkgtool/package_manager.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"

namespace {

constexpr off_t kLogReadLimit = 1 << 20;

std::string RealPath(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? buf : "";
}

// True when the existing file `path` resolves to a place inside `base`, so a
// symlink in a package's data folder cannot expose files outside it.
bool ResolvesInside(const std::string& path, const std::string& base) {
  std::string real_path = RealPath(path);
  std::string real_base = RealPath(base);
  return !real_path.empty() && !real_base.empty() &&
         real_path.compare(0, real_base.size() + 1, real_base + "/") == 0;
}

}  // namespace

bool PackageManager::init() {
  std::string dir = PackageRegistry::Dir();
  struct stat st;
  if (stat(dir.c_str(), &st) != 0) KIVOFSMkdirP(dir.c_str());
  bool ok = stat(dir.c_str(), &st) == 0 && S_ISDIR(st.st_mode) && access(dir.c_str(), R_OK | X_OK) == 0;
  result_ = ok ? PKG_RESULT_OK : PKG_RESULT_REGISTRY;
  return ok;
}

std::string PackageManager::getPackageLog(const std::string& id, bool evenIfMissing) {
  KeyValueMap info;
  if (!PackageRegistry::IsInstalled(id) || !PackageRegistry::ReadInfo(id, &info)) {
    result_ = PKG_RESULT_NOT_INSTALLED;
    return "";
  }
  result_ = PKG_RESULT_OK;
  const std::string& rel = info["logfile"];
  if (!PMSIsContainedRelativePath(rel)) return "";
  std::string base = PackageRegistry::RecordDir(id) + "/var";
  std::string path = base + "/" + rel;
  if (access(path.c_str(), F_OK) != 0) return evenIfMissing ? path : "";
  return ResolvesInside(path, base) ? path : "";
}

std::string PMSReadPackageLog(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "";
  struct stat st;
  std::string text;
  if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) {
    off_t start = st.st_size > kLogReadLimit ? st.st_size - kLogReadLimit : 0;
    text.resize(static_cast<size_t>(st.st_size - start));
    ssize_t n = pread(fd, &text[0], text.size(), start);
    text.resize(n > 0 ? static_cast<size_t>(n) : 0);
  }
  close(fd);
  return text;
}
