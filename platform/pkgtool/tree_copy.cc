#include "pkgtool/tree_copy.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <functional>
#include <map>
#include <set>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "klibc/scoped_fd.h"
#include "pkgtool/registry.h"

#include <linux/fs.h>

namespace {

constexpr int kMaxDepth = 128;
constexpr uint64_t kBlock = 4096;
constexpr size_t kMaxXattrValue = 65536;  // the kernel's own limit (XATTR_SIZE_MAX)

using FileKey = std::pair<dev_t, ino_t>;

std::string Join(const std::string& prefix, const std::string& name) {
  return prefix.empty() ? name : prefix + "/" + name;
}

// The names in the folder open at `dir`, without "." and "..".
bool ListNames(int dir, std::vector<std::string>* names) {
  int copy = fcntl(dir, F_DUPFD_CLOEXEC, 0);
  DIR* d = copy >= 0 ? fdopendir(copy) : nullptr;
  if (!d) {
    if (copy >= 0) close(copy);
    return false;
  }
  rewinddir(d);
  errno = 0;
  while (struct dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names->push_back(e->d_name);
  }
  const bool ok = errno == 0;
  closedir(d);
  return ok;
}

bool ReadLinkAt(int dir, const std::string& name, std::string* target) {
  char buf[4096];
  ssize_t n = readlinkat(dir, name.c_str(), buf, sizeof(buf));
  if (n < 0 || static_cast<size_t>(n) >= sizeof(buf)) return false;
  target->assign(buf, static_cast<size_t>(n));
  return true;
}

// Opens entry `name` of `dir` (a regular file, or with O_DIRECTORY a folder)
// without following a symlink or blocking on a fifo put in its place; -1
// unless it is still the object `st` describes, since a walk must copy what
// it listed and nothing that took its place.
int OpenSame(int dir, const std::string& name, const struct stat& st, int flags) {
  int fd = openat(dir, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | flags);
  if (fd < 0) return -1;
  struct stat now;
  if (fstat(fd, &now) != 0 || now.st_dev != st.st_dev || now.st_ino != st.st_ino ||
      (now.st_mode & S_IFMT) != (st.st_mode & S_IFMT)) {
    close(fd);
    errno = ESTALE;
    return -1;
  }
  return fd;
}

// Why the entry `rel` (status `st`, symlink target `target`) cannot be
// copied safely; "" when it can.
std::string EntryProblem(const std::string& rel, const struct stat& st, const std::string& target) {
  if (S_ISFIFO(st.st_mode)) return rel + " is a fifo";
  if (S_ISSOCK(st.st_mode)) return rel + " is a socket";
  if (S_ISCHR(st.st_mode) || S_ISBLK(st.st_mode)) return rel + " is a device";
  if (S_ISLNK(st.st_mode) && !PMSSymlinkStaysInside(rel, target)) {
    return rel + " is a symlink to " + target + ", outside the data folder";
  }
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode) && !S_ISLNK(st.st_mode)) {
    return rel + " is of a kind that cannot be copied";
  }
  return "";
}

// How an entry is read: its status, and for a symlink its target.
bool StatEntry(int dir, const std::string& name, struct stat* st, std::string* target) {
  if (fstatat(dir, name.c_str(), st, AT_SYMLINK_NOFOLLOW) != 0) return false;
  return !S_ISLNK(st->st_mode) || ReadLinkAt(dir, name, target);
}

std::string Unreadable(const std::string& rel, int err) {
  return (rel.empty() ? std::string("the data folder") : rel) + " cannot be read (" +
         strerror(err) + ")";
}

class Surveyor {
 public:
  explicit Surveyor(TreeSurvey* out) : out_(out) {}
  bool Walk(int dir, const std::string& prefix, int depth);

 private:
  bool Fail(const std::string& problem) {
    out_->problem = problem;
    return false;
  }
  bool Visit(int dir, const std::string& name, const std::string& rel, int depth);
  uint64_t Room(const struct stat& st);

  TreeSurvey* out_;
  std::set<FileKey> linked_;  // files with several links, counted once
};

bool Surveyor::Walk(int dir, const std::string& prefix, int depth) {
  std::vector<std::string> names;
  if (!ListNames(dir, &names)) return Fail(Unreadable(prefix, errno));
  for (const std::string& name : names) {
    if (!Visit(dir, name, Join(prefix, name), depth)) return false;
  }
  return true;
}

bool Surveyor::Visit(int dir, const std::string& name, const std::string& rel, int depth) {
  struct stat st;
  std::string target;
  if (!StatEntry(dir, name, &st, &target)) return Fail(Unreadable(rel, errno));
  std::string problem = EntryProblem(rel, st, target);
  if (!problem.empty()) return Fail(problem);
  out_->bytes += Room(st);
  if (S_ISLNK(st.st_mode)) return true;
  if (S_ISDIR(st.st_mode) && depth > kMaxDepth) return Fail(rel + " is nested too deep");
  ScopedFd fd(OpenSame(dir, name, st, S_ISDIR(st.st_mode) ? O_DIRECTORY : 0));
  if (fd.get() < 0) return Fail(Unreadable(rel, errno));
  return !S_ISDIR(st.st_mode) || Walk(fd.get(), rel, depth + 1);
}

uint64_t Surveyor::Room(const struct stat& st) {
  if (!S_ISREG(st.st_mode)) return kBlock;
  if (st.st_nlink > 1 && !linked_.insert({st.st_dev, st.st_ino}).second) return 0;
  uint64_t blocks = (static_cast<uint64_t>(st.st_size) + kBlock - 1) / kBlock;
  return (blocks ? blocks : 1) * kBlock;
}

// Extended attributes through either descriptors or (for symlinks, which
// cannot be opened) paths that never follow the last component.
struct XattrAccess {
  std::function<ssize_t(char*, size_t)> list;
  std::function<ssize_t(const char*, void*, size_t)> get;
  std::function<int(const char*, const void*, size_t)> set;
};

XattrAccess FdXattrs(int fd) {
  return {[fd](char* b, size_t n) { return flistxattr(fd, b, n); },
          [fd](const char* k, void* v, size_t n) { return fgetxattr(fd, k, v, n); },
          [fd](const char* k, const void* v, size_t n) { return fsetxattr(fd, k, v, n, 0); }};
}

XattrAccess LinkXattrs(const std::string& path) {
  return {[path](char* b, size_t n) { return llistxattr(path.c_str(), b, n); },
          [path](const char* k, void* v, size_t n) { return lgetxattr(path.c_str(), k, v, n); },
          [path](const char* k, const void* v, size_t n) {
            return lsetxattr(path.c_str(), k, v, n, 0);
          }};
}

// Copies every extended attribute of `from` to `to`. A file system without
// extended attributes has none to copy; one that has them and a copy that
// cannot take them is a failure (errno set).
bool CopyXattrs(const XattrAccess& from, const XattrAccess& to) {
  ssize_t size = from.list(nullptr, 0);
  if (size < 0) return errno == ENOTSUP;
  std::vector<char> names(static_cast<size_t>(size) + 1);
  size = from.list(names.data(), names.size());
  if (size < 0) return false;
  std::vector<char> value(kMaxXattrValue);
  for (const char* key = names.data(); key < names.data() + size; key += strlen(key) + 1) {
    ssize_t n = from.get(key, value.data(), value.size());
    if (n < 0 || to.set(key, value.data(), static_cast<size_t>(n)) != 0) return false;
  }
  return true;
}

// Gives the open copy `to` the owner, extended attributes, mode and times of
// `from` (status `st`). The owner comes first because changing it clears
// setuid bits and file capabilities; the times last, after every change.
bool KeepMetadata(int from, int to, const struct stat& st) {
  if (fchown(to, st.st_uid, st.st_gid) != 0) return false;
  if (!CopyXattrs(FdXattrs(from), FdXattrs(to))) return false;
  if (fchmod(to, st.st_mode & 07777) != 0) return false;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  return futimens(to, times) == 0;
}

std::string FdPath(int dir, const std::string& name) {
  return "/proc/self/fd/" + std::to_string(dir) + "/" + name;
}

bool KeepLinkMetadata(int from_dir, int to_dir, const std::string& name, const struct stat& st) {
  if (fchownat(to_dir, name.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return false;
  if (!CopyXattrs(LinkXattrs(FdPath(from_dir, name)), LinkXattrs(FdPath(to_dir, name)))) {
    return false;
  }
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  return utimensat(to_dir, name.c_str(), times, AT_SYMLINK_NOFOLLOW) == 0;
}

// Copies `size` bytes of `in` to `out`: shares the blocks where the file
// system can, else copy_file_range, else read and write. 0 or an errno.
int CopyContent(int in, int out, off_t size) {
  if (size == 0 || ioctl(out, FICLONE, in) == 0) return 0;
  bool ranges = true;
  std::vector<char> buf;
  for (off_t done = 0; done < size;) {
    ssize_t n;
    if (ranges) {
      n = copy_file_range(in, nullptr, out, nullptr, static_cast<size_t>(size - done), 0);
      if (n < 0 && (errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP)) {
        ranges = false;
        continue;
      }
    } else {
      buf.resize(1 << 20);
      n = read(in, buf.data(), buf.size());
      if (n > 0) {
        ssize_t written = write(out, buf.data(), static_cast<size_t>(n));
        if (written < 0) return errno;
        if (written != n) return ENOSPC;  // a short write to a file: the room ran out
      }
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) return 0;  // it shrank; the caller sees that it changed
    done += n;
  }
  return 0;
}

bool SameContentState(const struct stat& a, const struct stat& b) {
  return a.st_size == b.st_size && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}

class Copier {
 public:
  explicit Copier(std::string* error) : error_(error) {}
  TreeCopyResult Copy(const std::string& from, const std::string& to);

 private:
  TreeCopyResult Children(int from, int to, const std::string& prefix, int depth);
  TreeCopyResult Entry(int from, int to, const std::string& name, const std::string& rel,
                       int depth);
  TreeCopyResult Folder(int from, int to, const std::string& name, const std::string& rel,
                        const struct stat& st, int depth);
  TreeCopyResult File(int from, int to, const std::string& name, const std::string& rel,
                      const struct stat& st);
  TreeCopyResult Link(int from, int to, const std::string& name, const std::string& rel,
                      const struct stat& st, const std::string& target);
  // A file with several hard links whose first link was copied already
  // becomes one more link to that copy.
  bool LinkedBefore(const struct stat& st, int to, const std::string& name, const std::string& rel,
                    TreeCopyResult* result);

  TreeCopyResult Fail(TreeCopyResult result, const std::string& text) {
    *error_ = text;
    return result;
  }
  TreeCopyResult FailErrno(const std::string& what, int err) {
    bool full = err == ENOSPC || err == EDQUOT;
    return Fail(full ? TreeCopyResult::kNoSpace : TreeCopyResult::kFailed,
                what + " (" + strerror(err) + ")");
  }

  std::string* error_;
  int to_root_ = -1;
  std::map<FileKey, std::string> first_links_;  // where each linked file's copy went
};

TreeCopyResult Copier::Copy(const std::string& from, const std::string& to) {
  ScopedFd src(open(from.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat st;
  if (src.get() < 0 || fstat(src.get(), &st) != 0) {
    return Fail(TreeCopyResult::kRefused, Unreadable("", errno));
  }
  if (mkdir(to.c_str(), 0700) != 0) return FailErrno("cannot make the copy's folder", errno);
  ScopedFd dst(open(to.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dst.get() < 0) return FailErrno("cannot open the copy's folder", errno);
  to_root_ = dst.get();
  TreeCopyResult result = Children(src.get(), dst.get(), "", 1);
  if (result != TreeCopyResult::kCopied) return result;
  if (!KeepMetadata(src.get(), dst.get(), st)) {
    return FailErrno("cannot keep the data folder's owner, mode, times or attributes", errno);
  }
  return TreeCopyResult::kCopied;
}

TreeCopyResult Copier::Children(int from, int to, const std::string& prefix, int depth) {
  std::vector<std::string> names;
  if (!ListNames(from, &names)) return Fail(TreeCopyResult::kRefused, Unreadable(prefix, errno));
  for (const std::string& name : names) {
    TreeCopyResult result = Entry(from, to, name, Join(prefix, name), depth);
    if (result != TreeCopyResult::kCopied) return result;
  }
  return TreeCopyResult::kCopied;
}

TreeCopyResult Copier::Entry(int from, int to, const std::string& name, const std::string& rel,
                             int depth) {
  struct stat st;
  std::string target;
  if (!StatEntry(from, name, &st, &target)) {
    return Fail(TreeCopyResult::kRefused, Unreadable(rel, errno));
  }
  // The survey saw the tree before the package stopped; judged again here,
  // an entry made since cannot slip in.
  std::string problem = EntryProblem(rel, st, target);
  if (!problem.empty()) return Fail(TreeCopyResult::kRefused, problem);
  if (S_ISDIR(st.st_mode)) return Folder(from, to, name, rel, st, depth);
  if (S_ISLNK(st.st_mode)) return Link(from, to, name, rel, st, target);
  return File(from, to, name, rel, st);
}

TreeCopyResult Copier::Folder(int from, int to, const std::string& name, const std::string& rel,
                              const struct stat& st, int depth) {
  if (depth > kMaxDepth) return Fail(TreeCopyResult::kRefused, rel + " is nested too deep");
  ScopedFd src(OpenSame(from, name, st, O_DIRECTORY));
  if (src.get() < 0) return Fail(TreeCopyResult::kRefused, Unreadable(rel, errno));
  if (mkdirat(to, name.c_str(), 0700) != 0) return FailErrno("cannot copy " + rel, errno);
  ScopedFd dst(openat(to, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dst.get() < 0) return FailErrno("cannot copy " + rel, errno);
  TreeCopyResult result = Children(src.get(), dst.get(), rel, depth + 1);
  if (result != TreeCopyResult::kCopied) return result;
  if (!KeepMetadata(src.get(), dst.get(), st)) {
    return FailErrno("cannot keep the owner, mode, times or attributes of " + rel, errno);
  }
  return TreeCopyResult::kCopied;
}

bool Copier::LinkedBefore(const struct stat& st, int to, const std::string& name,
                          const std::string& rel, TreeCopyResult* result) {
  if (st.st_nlink < 2) return false;
  auto first = first_links_.emplace(FileKey{st.st_dev, st.st_ino}, rel);
  if (first.second) return false;
  *result = linkat(to_root_, first.first->second.c_str(), to, name.c_str(), 0) == 0
                ? TreeCopyResult::kCopied
                : FailErrno("cannot link " + rel + " to " + first.first->second, errno);
  return true;
}

TreeCopyResult Copier::File(int from, int to, const std::string& name, const std::string& rel,
                            const struct stat& st) {
  TreeCopyResult linked;
  if (LinkedBefore(st, to, name, rel, &linked)) return linked;
  ScopedFd src(OpenSame(from, name, st, 0));
  if (src.get() < 0) return Fail(TreeCopyResult::kRefused, Unreadable(rel, errno));
  ScopedFd dst(
      openat(to, name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (dst.get() < 0) return FailErrno("cannot copy " + rel, errno);
  int err = CopyContent(src.get(), dst.get(), st.st_size);
  if (err != 0) return FailErrno("cannot copy " + rel, err);
  struct stat after;
  if (fstat(src.get(), &after) != 0 || !SameContentState(st, after)) {
    return Fail(TreeCopyResult::kRefused, rel + " changed while it was copied");
  }
  if (!KeepMetadata(src.get(), dst.get(), st)) {
    return FailErrno("cannot keep the owner, mode, times or attributes of " + rel, errno);
  }
  return TreeCopyResult::kCopied;
}

TreeCopyResult Copier::Link(int from, int to, const std::string& name, const std::string& rel,
                            const struct stat& st, const std::string& target) {
  if (symlinkat(target.c_str(), to, name.c_str()) != 0) {
    return FailErrno("cannot copy " + rel, errno);
  }
  if (!KeepLinkMetadata(from, to, name, st)) {
    return FailErrno("cannot keep the owner, times or attributes of " + rel, errno);
  }
  return TreeCopyResult::kCopied;
}

}  // namespace

bool PMSSurveyTree(const std::string& root, TreeSurvey* survey) {
  *survey = TreeSurvey();
  ScopedFd dir(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) {
    survey->problem = Unreadable("", errno);
    return false;
  }
  survey->bytes = kBlock;
  return Surveyor(survey).Walk(dir.get(), "", 1);
}

TreeCopyResult PMSCopyTree(const std::string& from, const std::string& to, std::string* error) {
  return Copier(error).Copy(from, to);
}

bool PMSCanReflink(const std::string& dir) {
  std::string first = dir + "/.reflink-probe-XXXXXX";
  int in = mkostemp(&first[0], O_CLOEXEC);
  if (in < 0) return false;
  std::string second = first + ".copy";
  int out = open(second.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  // A clone needs a block to share: an empty file clones on any system.
  bool shared = write(in, "x", 1) == 1 && out >= 0 && ioctl(out, FICLONE, in) == 0;
  close(in);
  if (out >= 0) close(out);
  unlink(first.c_str());
  unlink(second.c_str());
  return shared;
}
