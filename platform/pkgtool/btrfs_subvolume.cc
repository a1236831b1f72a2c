#include "pkgtool/btrfs_subvolume.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include "klibc/scoped_fd.h"

#include <linux/btrfs.h>
#include <linux/magic.h>

namespace {

// The inode number of every subvolume's top folder (the kernel's
// BTRFS_FIRST_FREE_OBJECTID, which the user headers do not export).
constexpr ino_t kSubvolumeTopInode = 256;

std::string Parent(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

std::string Leaf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

// Opens the parent folder of `path` for an ioctl naming `path`'s last
// component, which must fit the kernel's name field. -1 (errno set) if not.
int OpenParent(const std::string& path) {
  const std::string leaf = Leaf(path);
  if (leaf.empty() || leaf.size() > BTRFS_SUBVOL_NAME_MAX || leaf == "." || leaf == "..") {
    errno = EINVAL;
    return -1;
  }
  return open(Parent(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
}

}  // namespace

bool PMSOnBtrfs(const std::string& path) {
  struct statfs fs;
  return statfs(path.c_str(), &fs) == 0 &&
         fs.f_type == static_cast<decltype(fs.f_type)>(BTRFS_SUPER_MAGIC);
}

bool PMSIsSubvolume(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) || st.st_ino != kSubvolumeTopInode) {
    return false;
  }
  return PMSOnBtrfs(path);
}

bool PMSCopiesBySnapshot(const std::string& path) {
  if (!PMSIsSubvolume(path)) return false;
  ScopedFd dir(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) return false;
  // The subvolumes whose parent is this one, wherever in it they lie; more
  // than fit in one answer fail with EOVERFLOW, which says as much.
  struct btrfs_ioctl_get_subvol_rootref_args refs;
  memset(&refs, 0, sizeof(refs));
  return ioctl(dir.get(), BTRFS_IOC_GET_SUBVOL_ROOTREF, &refs) == 0 && refs.num_items == 0;
}

bool PMSMakeSubvolume(const std::string& path, unsigned mode) {
  ScopedFd parent(OpenParent(path));
  if (parent.get() < 0) return false;
  struct btrfs_ioctl_vol_args args;
  memset(&args, 0, sizeof(args));
  strncpy(args.name, Leaf(path).c_str(), sizeof(args.name) - 1);
  if (ioctl(parent.get(), BTRFS_IOC_SUBVOL_CREATE, &args) != 0) return false;
  // A new subvolume's top folder is 0755 whatever the umask: set what was asked.
  return chmod(path.c_str(), mode) == 0;
}

bool PMSSnapshotSubvolume(const std::string& from, const std::string& to) {
  ScopedFd source(open(from.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (source.get() < 0) return false;
  ScopedFd parent(OpenParent(to));
  if (parent.get() < 0) return false;
  struct btrfs_ioctl_vol_args_v2 args;
  memset(&args, 0, sizeof(args));
  args.fd = source.get();  // no flags: read-write, so that it can be put back as the data
  strncpy(args.name, Leaf(to).c_str(), sizeof(args.name) - 1);
  return ioctl(parent.get(), BTRFS_IOC_SNAP_CREATE_V2, &args) == 0;
}

bool PMSDestroySubvolume(const std::string& path) {
  if (!PMSIsSubvolume(path)) {
    errno = EINVAL;
    return false;
  }
  ScopedFd parent(OpenParent(path));
  if (parent.get() < 0) return false;
  struct btrfs_ioctl_vol_args_v2 args;
  memset(&args, 0, sizeof(args));
  strncpy(args.name, Leaf(path).c_str(), sizeof(args.name) - 1);
  return ioctl(parent.get(), BTRFS_IOC_SNAP_DESTROY_V2, &args) == 0;
}
