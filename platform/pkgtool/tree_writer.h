// Writes a tree of files beneath one folder without ever leaving it: paths
// are relative, components are opened one by one with O_NOFOLLOW, so a
// symlink written earlier can never redirect a later write.
#pragma once

#include <string>
#include <sys/types.h>

class TreeWriter {
 public:
  // `root` must be an existing folder. Check ok().
  explicit TreeWriter(const std::string& root);
  ~TreeWriter();
  TreeWriter(const TreeWriter&) = delete;
  TreeWriter& operator=(const TreeWriter&) = delete;

  bool ok() const { return root_fd_ >= 0; }

  // Each returns 0 or an errno value. `path` is a checked relative path.
  // Modes are applied exactly, whatever the umask, with the permission bits
  // and the sticky bit (01777); setuid and setgid are never set.
  //
  // Makes a folder, or gives an existing one (never a symlink) `mode`.
  [[nodiscard]] int MakeDirectory(const std::string& path, mode_t mode);
  // Creates a new regular file (an existing one is an error: EEXIST) and
  // returns its descriptor in *fd; the caller writes and closes it.
  [[nodiscard]] int CreateFile(const std::string& path, mode_t mode, int* fd);
  [[nodiscard]] int MakeSymlink(const std::string& path, const std::string& target);

 private:
  // Opens the folder that holds `path`'s last component, creating missing
  // folders; *name gets the last component. -1 with errno on failure.
  int OpenParent(const std::string& path, std::string* name);

  int root_fd_ = -1;
  std::string cached_dir_;  // the relative folder cached_fd_ is open on
  int cached_fd_ = -1;
};
