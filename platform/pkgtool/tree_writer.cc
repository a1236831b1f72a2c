#include "pkgtool/tree_writer.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

TreeWriter::TreeWriter(const std::string& root) {
  root_fd_ = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
}

TreeWriter::~TreeWriter() {
  if (cached_fd_ >= 0) close(cached_fd_);
  if (root_fd_ >= 0) close(root_fd_);
}

int TreeWriter::OpenParent(const std::string& path, std::string* name) {
  size_t slash = path.rfind('/');
  std::string dir = slash == std::string::npos ? "" : path.substr(0, slash);
  *name = slash == std::string::npos ? path : path.substr(slash + 1);
  // Archives list a folder's files together; keep that folder open.
  if (cached_fd_ >= 0 && dir == cached_dir_) return cached_fd_;
  int fd = dup(root_fd_);
  size_t start = 0;
  while (fd >= 0 && start < dir.size()) {
    size_t end = dir.find('/', start);
    if (end == std::string::npos) end = dir.size();
    std::string part = dir.substr(start, end - start);
    start = end + 1;
    if (mkdirat(fd, part.c_str(), 0755) != 0 && errno != EEXIST) {
      close(fd);
      return -1;
    }
    int next = openat(fd, part.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    int saved = errno;
    close(fd);
    errno = saved;
    fd = next;
  }
  if (fd < 0) return -1;
  if (cached_fd_ >= 0) close(cached_fd_);
  cached_fd_ = fd;
  cached_dir_ = dir;
  return fd;
}

namespace {

constexpr mode_t kKeptBits = 01777;

// Sets the mode of the open `fd` and closes it; 0 or an errno value.
int ChmodAndClose(int fd, mode_t mode) {
  int err = fchmod(fd, mode & kKeptBits) == 0 ? 0 : errno;
  close(fd);
  return err;
}

}  // namespace

int TreeWriter::MakeDirectory(const std::string& path, mode_t mode) {
  std::string name;
  int parent = OpenParent(path, &name);
  if (parent < 0) return errno;
  if (mkdirat(parent, name.c_str(), 0700) != 0 && errno != EEXIST) return errno;
  // Opened without following a symlink, so an existing entry of that name
  // must be a real folder; its mode is set through the descriptor.
  int fd = openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return errno == ELOOP ? ENOTDIR : errno;
  return ChmodAndClose(fd, mode);
}

int TreeWriter::CreateFile(const std::string& path, mode_t mode, int* fd) {
  std::string name;
  int parent = OpenParent(path, &name);
  if (parent < 0) return errno;
  *fd = openat(parent, name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (*fd < 0) return errno;
  // The umask applied at creation would drop group and other write bits.
  if (fchmod(*fd, mode & kKeptBits) == 0) return 0;
  int err = errno;
  close(*fd);
  *fd = -1;
  return err;
}

int TreeWriter::MakeSymlink(const std::string& path, const std::string& target) {
  std::string name;
  int parent = OpenParent(path, &name);
  if (parent < 0) return errno;
  return symlinkat(target.c_str(), parent, name.c_str()) == 0 ? 0 : errno;
}
