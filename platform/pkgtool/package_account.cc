#include "pkgtool/package_account.h"

#include <cctype>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <memory>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "klibc/account_name.h"
#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/sysroot.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"

namespace {

constexpr char kCommentPrefix[] = "kivo package ";
constexpr int kNameTries = 100;
constexpr size_t kMaxAccountName = 32;
constexpr size_t kHashedStem = 17;  // "pkg-" + 17 + "-" + 10 hex digits = 32

// One line of etc/passwd or etc/group, as the C library reads it.
struct AccountLine {
  std::string name, password, comment, home, shell;
  std::vector<std::string> members;
  unsigned id = 0, group = 0;
};

struct FileCloser {
  void operator()(FILE* f) const { fclose(f); }
};
using UniqueFile = std::unique_ptr<FILE, FileCloser>;

// The lines of etc/passwd (`groups` false) or etc/group. False when the file
// exists but cannot be read.
bool ReadAccountLines(bool groups, std::vector<AccountLine>* lines) {
  const std::string path = KIVORootPath(groups ? "/etc/group" : "/etc/passwd");
  UniqueFile f(fopen(path.c_str(), "re"));
  if (!f) return errno == ENOENT;
  if (groups) {
    for (struct group* g; (g = fgetgrent(f.get()));) {
      AccountLine l{g->gr_name, g->gr_passwd ? g->gr_passwd : "", "", "", "", {}, g->gr_gid, 0};
      for (char** m = g->gr_mem; m && *m; ++m) l.members.push_back(*m);
      lines->push_back(l);
    }
  } else {
    for (struct passwd* p; (p = fgetpwent(f.get()));) {
      lines->push_back({p->pw_name,
                        p->pw_passwd ? p->pw_passwd : "",
                        p->pw_gecos ? p->pw_gecos : "",
                        p->pw_dir ? p->pw_dir : "",
                        p->pw_shell ? p->pw_shell : "",
                        {},
                        p->pw_uid,
                        p->pw_gid});
    }
  }
  return ferror(f.get()) == 0;
}

// Writes `lines` back through the C library's own line writers, replacing
// the file atomically.
bool WriteAccountLines(bool groups, const std::vector<AccountLine>& lines) {
  char* text = nullptr;
  size_t size = 0;
  FILE* out = open_memstream(&text, &size);
  if (!out) return false;
  bool ok = true;
  for (const AccountLine& l : lines) {
    if (groups) {
      std::vector<char*> members;
      for (const std::string& m : l.members) members.push_back(const_cast<char*>(m.c_str()));
      members.push_back(nullptr);
      struct group g = {const_cast<char*>(l.name.c_str()), const_cast<char*>(l.password.c_str()),
                        l.id, members.data()};
      ok &= putgrent(&g, out) == 0;
    } else {
      struct passwd p = {const_cast<char*>(l.name.c_str()),
                         const_cast<char*>(l.password.c_str()),
                         l.id,
                         l.group,
                         const_cast<char*>(l.comment.c_str()),
                         const_cast<char*>(l.home.c_str()),
                         const_cast<char*>(l.shell.c_str())};
      ok &= putpwent(&p, out) == 0;
    }
  }
  ok &= fclose(out) == 0;
  std::string content = ok ? std::string(text, size) : "";
  free(text);
  return ok && KIVOWriteFileAtomic(KIVORootPath(groups ? "/etc/group" : "/etc/passwd"), content,
                                   SyncToDisk::Yes, 0644);
}

uint64_t Fnv1a(const std::string& text) {
  uint64_t h = 14695981039346656037ULL;
  for (unsigned char c : text) {
    h ^= c;
    h *= 1099511628211ULL;
  }
  return h;
}

bool IsPackagesLine(const AccountLine& l, const std::string& id) {
  return l.comment == kCommentPrefix + id && l.id != 0;
}

const AccountLine* FindByName(const std::vector<AccountLine>& lines, const std::string& name) {
  for (const AccountLine& l : lines) {
    if (l.name == name) return &l;
  }
  return nullptr;
}

bool IdUsed(const std::vector<AccountLine>& users, const std::vector<AccountLine>& groups,
            unsigned id) {
  for (const AccountLine& l : users) {
    if (l.id == id || l.group == id) return true;
  }
  for (const AccountLine& l : groups) {
    if (l.id == id) return true;
  }
  return false;
}

// The range of pkgtool.conf; the default one when the settings make no
// range of ids above the system's own (1000).
void IdRange(unsigned* first, unsigned* last) {
  int f = PMSToolSetting("package_uid_first", 30000, 1000);
  int l = PMSToolSetting("package_uid_last", 39999, 1000);
  if (f > l) f = 30000, l = 39999;
  *first = static_cast<unsigned>(f);
  *last = static_cast<unsigned>(l);
}

// What a walk that gives a tree to an account needs at every entry.
struct ChownWalk {
  uid_t uid;
  gid_t gid;
  const DataChangeGate& may_change;
  std::string* error;
};

bool ChownAt(int dir, const char* name, const ChownWalk& walk, const std::string& path);

// Gives what folder `dir` (open) holds to uid:gid, depth first.
bool ChownEntries(int dir, const ChownWalk& walk, const std::string& path) {
  DIR* d = fdopendir(dup(dir));
  if (!d) return (*walk.error = "cannot read " + path), false;
  bool ok = true;
  while (struct dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") == 0 || strcmp(e->d_name, "..") == 0) continue;
    ok &= ChownAt(dir, e->d_name, walk, path + "/" + e->d_name);
  }
  closedir(d);
  return ok;
}

bool ChownAt(int dir, const char* name, const ChownWalk& walk, const std::string& path) {
  struct stat st;
  std::string* error = walk.error;
  if (fstatat(dir, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
    return (*error = "cannot read " + path), false;
  }
  if (!S_ISDIR(st.st_mode) && st.st_nlink > 1) return true;  // see the header
  if (st.st_uid != walk.uid || st.st_gid != walk.gid) {
    if (walk.may_change && !walk.may_change()) {
      return (*error = "the owner of " + path + " may not be changed now"), false;
    }
    if (fchownat(dir, name, walk.uid, walk.gid, AT_SYMLINK_NOFOLLOW) != 0) {
      return (*error = "cannot change the owner of " + path + ": " + strerror(errno)), false;
    }
  }
  if (!S_ISDIR(st.st_mode)) return true;
  int sub = openat(dir, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (sub < 0) return (*error = "cannot open " + path), false;
  bool ok = ChownEntries(sub, walk, path);
  close(sub);
  return ok;
}

}  // namespace

std::string PMSPackageAccountName(const std::string& id, int attempt) {
  std::string stem;
  for (char c : id)
    stem += c == '+' ? '_' : static_cast<char>(tolower(static_cast<unsigned char>(c)));
  const std::string plain = "pkg-" + stem;
  if (attempt == 0 && stem == id && plain.size() <= kMaxAccountName) return plain;
  char hash[16];
  snprintf(hash, sizeof(hash), "%010" PRIx64,
           static_cast<uint64_t>(Fnv1a(attempt == 0 ? id : id + "#" + std::to_string(attempt)) &
                                 0xffffffffffULL));
  return "pkg-" + stem.substr(0, kHashedStem) + "-" + hash;
}

bool PMSFindPackageAccount(const std::string& id, PackageAccount* account) {
  std::vector<AccountLine> users;
  if (!PMSIsValidPackageId(id) || !ReadAccountLines(false, &users)) return false;
  for (const AccountLine& l : users) {
    if (IsPackagesLine(l, id)) {
      *account = {l.name, static_cast<uid_t>(l.id), static_cast<gid_t>(l.group)};
      return true;
    }
  }
  return false;
}

int PMSEnsurePackageAccount(const std::string& id, PackageAccount* account, std::string* error,
                            bool* created) {
  if (created) *created = false;
  if (!PMSIsValidPackageId(id)) return (*error = "not a valid package id"), PKG_ERR_INTERNAL;
  const std::string lock_path = KIVOAccountsLockPath();
  static_cast<void>(KIVOFSMkdirP(lock_path.substr(0, lock_path.rfind('/')).c_str()));
  FileLock lock(lock_path);
  std::vector<AccountLine> users, groups;
  if (!lock.held() || !ReadAccountLines(false, &users) || !ReadAccountLines(true, &groups)) {
    *error = "cannot lock or read the accounts files under " + KIVORootPath("/etc");
    return PKG_ERR_ACCOUNT_FILES;
  }
  bool found = false;
  for (const AccountLine& l : users) {
    if (IsPackagesLine(l, id)) {
      *account = {l.name, static_cast<uid_t>(l.id), static_cast<gid_t>(l.group)};
      found = true;
    }
  }
  if (!found) {
    std::string name;
    for (int attempt = 0; attempt < kNameTries && name.empty(); ++attempt) {
      std::string candidate = PMSPackageAccountName(id, attempt);
      if (!FindByName(users, candidate) && !FindByName(groups, candidate)) name = candidate;
    }
    unsigned first, last, id_num = 0;
    IdRange(&first, &last);
    for (unsigned n = first; n <= last && id_num == 0; ++n) {
      if (!IdUsed(users, groups, n)) id_num = n;
    }
    if (name.empty() || id_num == 0) {
      *error = name.empty() ? "no free account name for " + id
                            : "no free id from " + std::to_string(first) + " to " +
                                  std::to_string(last) + " (package_uid_first, package_uid_last)";
      return PKG_ERR_NO_ACCOUNT_ID;
    }
    groups.push_back({name, "x", "", "", "", {}, id_num, 0});
    users.push_back(
        {name, "x", kCommentPrefix + id, "/nonexistent", "/sbin/nologin", {}, id_num, id_num});
    // The group first: a passwd line never names a group that is missing.
    if (!WriteAccountLines(true, groups) || !WriteAccountLines(false, users)) {
      *error = "cannot write the accounts files under " + KIVORootPath("/etc");
      return PKG_ERR_ACCOUNT_FILES;
    }
    *account = {name, static_cast<uid_t>(id_num), static_cast<gid_t>(id_num)};
    if (created) *created = true;
  }
  return PKG_OK;
}

bool PMSRemovePackageAccount(const std::string& id, std::string* error) {
  if (!PMSIsValidPackageId(id)) return true;
  FileLock lock(KIVOAccountsLockPath());
  std::vector<AccountLine> users, groups;
  if (!lock.held() || !ReadAccountLines(false, &users) || !ReadAccountLines(true, &groups)) {
    return (*error = "cannot lock or read the accounts files"), false;
  }
  std::string name;
  std::vector<AccountLine> kept_users, kept_groups;
  for (const AccountLine& l : users) {
    if (IsPackagesLine(l, id)) {
      name = l.name;
    } else {
      kept_users.push_back(l);
    }
  }
  if (name.empty()) return true;
  for (const AccountLine& l : groups) {
    if (l.name != name) kept_groups.push_back(l);
  }
  // The user first: a passwd line never names a group that is missing.
  if (!WriteAccountLines(false, kept_users) || !WriteAccountLines(true, kept_groups)) {
    return (*error = "cannot write the accounts files"), false;
  }
  return true;
}

bool PMSChownTree(const std::string& dir, uid_t uid, gid_t gid, std::string* error,
                  const DataChangeGate& may_change) {
  const size_t slash = dir.rfind('/');
  if (slash == std::string::npos || slash + 1 >= dir.size()) return (*error = "bad folder"), false;
  int parent =
      open(slash == 0 ? "/" : dir.substr(0, slash).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (parent < 0) return (*error = "cannot open the folder above " + dir), false;
  bool ok = ChownAt(parent, dir.c_str() + slash + 1, ChownWalk{uid, gid, may_change, error}, dir);
  close(parent);
  return ok;
}

void PMSMakeReachable(const std::string& path) {
  const std::string root = KIVOSysRoot();
  if (!root.empty() && path.compare(0, root.size() + 1, root + "/") != 0) return;
  // Each folder from the root (itself included) to the parent of `path`.
  for (size_t end = root.empty() ? 0 : root.size(); end != std::string::npos;
       end = path.find('/', end + 1)) {
    const std::string dir = end == 0 ? "/" : path.substr(0, end);
    struct stat st;
    if (lstat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return;
    // Search only: the names in the folder stay unlisted.
    if (!(st.st_mode & S_IXOTH))
      static_cast<void>(chmod(dir.c_str(), (st.st_mode & 07777) | S_IXOTH));
  }
}
