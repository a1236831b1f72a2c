#include "klibc/atomic_file.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/last_error.h"

namespace {

bool WriteAll(int fd, const char* data, size_t size) {
  while (size > 0) {
    ssize_t n = write(fd, data, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

void SetWriteError() {
  KLIBCErrSet(errno == ENOSPC || errno == EDQUOT ? KLIBC_ERR_NO_SPACE : KLIBC_ERR_FILE_WRITE);
}

}  // namespace

bool KIVOWriteFileAtomic(const std::string& path, const std::string& content, SyncToDisk sync,
                         unsigned mode) {
  std::string tmp = path + ".XXXXXX";
  int fd = mkostemp(&tmp[0], O_CLOEXEC);
  if (fd < 0) {
    SetWriteError();
    return false;
  }
  bool ok = fchmod(fd, mode & ~0u) == 0 && WriteAll(fd, content.data(), content.size()) &&
            (sync == SyncToDisk::No || fsync(fd) == 0);
  if (!ok) SetWriteError();
  if (close(fd) != 0 && ok) {
    SetWriteError();
    ok = false;
  }
  if (ok && rename(tmp.c_str(), path.c_str()) != 0) {
    SetWriteError();
    ok = false;
  }
  if (!ok) unlink(tmp.c_str());
  return ok;
}

bool KIVOReadFile(const std::string& path, std::string* content, size_t limit) {
  content->clear();
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    KLIBCErrSet(errno == ENOENT ? KLIBC_ERR_NOT_FOUND : KLIBC_ERR_FILE_OPEN);
    return false;
  }
  // Reading into the file's size at once spares a large file the copies of
  // a string that grows block by block.
  struct stat st;
  if (fstat(fd, &st) == 0 && st.st_size > 0)
    content->reserve(std::min(static_cast<size_t>(st.st_size), limit));
  char buf[65536];
  bool ok = true;
  while (content->size() < limit) {
    size_t want = std::min(sizeof(buf), limit - content->size());
    ssize_t n = read(fd, buf, want);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      KLIBCErrSet(KLIBC_ERR_FILE_READ);
      ok = false;
      break;
    }
    if (n == 0) break;
    content->append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return ok;
}

bool KLIBCFileExist(const char* path) {
  struct stat st;
  return path && lstat(path, &st) == 0;
}

int KIVORemoveFilesOlderThan(const std::string& dir, const std::string& prefix, long age_seconds) {
  DIR* d = opendir(dir.c_str());
  if (!d) return 0;
  time_t now = time(nullptr);
  int removed = 0;
  while (struct dirent* e = readdir(d)) {
    if (strncmp(e->d_name, prefix.c_str(), prefix.size()) != 0) continue;
    std::string path = dir + "/" + e->d_name;
    struct stat st;
    if (lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && now - st.st_mtime > age_seconds &&
        unlink(path.c_str()) == 0) {
      ++removed;
    }
  }
  closedir(d);
  return removed;
}

int KIVOFSMkdirP(const char* path, unsigned mode) {
  if (!path || !*path) return -1;
  std::string p(path);
  for (size_t i = 1; i <= p.size(); ++i) {
    if (i != p.size() && p[i] != '/') continue;
    std::string part = p.substr(0, i);
    if (mkdir(part.c_str(), mode) != 0 && errno != EEXIST) {
      KLIBCErrSet(errno == ENOSPC ? KLIBC_ERR_NO_SPACE : KLIBC_ERR_FILE_WRITE);
      return -1;
    }
  }
  struct stat st;
  return stat(path, &st) == 0 && S_ISDIR(st.st_mode) ? 0 : -1;
}
