#include "accounts/accounts.h"

#include <algorithm>
#include <crypt.h>
#include <cstdio>
#include <cstring>
#include <dlfcn.h>
#include <grp.h>
#include <memory>
#include <pwd.h>
#include <shadow.h>
#include <sstream>

#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/sysroot.h"

namespace {

// libcrypt is needed only to sign in and to set passwords, but entry.cgi
// starts for every request; loading it on first use keeps it out of every
// other request's start-up.
struct CryptLibrary {
  using CryptR = char* (*)(const char*, const char*, struct crypt_data*);
  using GenSalt = char* (*)(const char*, unsigned long, const char*, int, char*, int);
  CryptR crypt_r = nullptr;
  GenSalt gensalt = nullptr;
};

const CryptLibrary& Crypt() {
  static const CryptLibrary lib = [] {
    CryptLibrary l;
    if (void* handle = dlopen("libcrypt.so.1", RTLD_NOW | RTLD_LOCAL)) {
      l.crypt_r = reinterpret_cast<CryptLibrary::CryptR>(dlsym(handle, "crypt_r"));
      l.gensalt = reinterpret_cast<CryptLibrary::GenSalt>(dlsym(handle, "crypt_gensalt_rn"));
    }
    return l;
  }();
  return lib;
}

// crypt_r of the lazily loaded library; null when it cannot be loaded.
const char* CryptR(const std::string& password, const char* setting, struct crypt_data* data) {
  return Crypt().crypt_r ? Crypt().crypt_r(password.c_str(), setting, data) : nullptr;
}

struct FileCloser {
  void operator()(FILE* f) const { fclose(f); }
};
using UniqueFile = std::unique_ptr<FILE, FileCloser>;

UniqueFile OpenRootFile(const char* fixed) {
  return UniqueFile(fopen(KIVORootPath(fixed).c_str(), "re"));
}

// The stored hash of `account`, from shadow, or from passwd when passwd holds
// the hash itself. Empty when the account is unknown.
std::string StoredHash(const std::string& account) {
  std::string hash;
  UniqueFile pw = OpenRootFile("/etc/passwd");
  for (struct passwd* p; pw && (p = fgetpwent(pw.get()));) {
    if (account == p->pw_name) hash = p->pw_passwd ? p->pw_passwd : "";
  }
  if (hash != "x") return hash;
  hash.clear();
  UniqueFile sp = OpenRootFile("/etc/shadow");
  for (struct spwd* s; sp && (s = fgetspent(sp.get()));) {
    if (account == s->sp_namp) hash = s->sp_pwdp ? s->sp_pwdp : "";
  }
  return hash;
}

// Locked ("!..."), disabled ("*") and empty hashes never match.
bool IsUsableHash(const std::string& hash) {
  return !hash.empty() && hash[0] != '!' && hash[0] != '*';
}

std::string NewSetting() {
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  if (!Crypt().gensalt || !Crypt().gensalt("$y$", 0, nullptr, 0, salt, sizeof(salt))) return "";
  return salt;
}

// What a password is hashed with when the account cannot sign in: the first
// usable hash of the shadow file (its method, cost and salt, so the work is
// that of a real account's check), else a fresh setting as new passwords get.
std::string StandInSetting() {
  UniqueFile sp = OpenRootFile("/etc/shadow");
  for (struct spwd* s; sp && (s = fgetspent(sp.get()));) {
    if (s->sp_pwdp && IsUsableHash(s->sp_pwdp)) return s->sp_pwdp;
  }
  return NewSetting();
}

std::vector<std::string> ReadLines(const char* fixed) {
  std::vector<std::string> lines;
  std::string text;
  if (!KIVOReadFile(KIVORootPath(fixed), &text)) return lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) {
    if (!line.empty()) lines.push_back(line);
  }
  return lines;
}

bool WriteLines(const char* fixed, const std::vector<std::string>& lines, unsigned mode) {
  std::string text;
  for (const std::string& line : lines) text += line + "\n";
  return KIVOWriteFileAtomic(KIVORootPath(fixed), text, SyncToDisk::Yes, mode);
}

std::string FieldOf(const std::string& line, size_t index) {
  std::istringstream in(line);
  std::string field;
  for (size_t i = 0; i <= index; ++i) {
    if (!std::getline(in, field, ':')) return "";
  }
  return field;
}

// Replaces the line whose first field is `name`, or appends `line`.
void Upsert(std::vector<std::string>* lines, const std::string& name, const std::string& line) {
  for (std::string& l : *lines) {
    if (FieldOf(l, 0) == name) {
      l = line;
      return;
    }
  }
  lines->push_back(line);
}

unsigned NextFreeId(const std::vector<std::string>& lines, unsigned first) {
  unsigned id = first;
  for (const std::string& l : lines) {
    id = std::max(id, static_cast<unsigned>(std::strtoul(FieldOf(l, 2).c_str(), nullptr, 10)) + 1);
  }
  return id;
}

std::string HashPassword(const std::string& password) {
  std::string setting = NewSetting();
  if (setting.empty()) return "";
  struct crypt_data data;
  memset(&data, 0, sizeof(data));
  const char* hash = CryptR(password, setting.c_str(), &data);
  return hash && hash[0] != '*' ? hash : "";
}

std::string AddMember(const std::string& group_line, const std::string& account) {
  std::string members = FieldOf(group_line, 3);
  std::istringstream in(members);
  for (std::string m; std::getline(in, m, ',');) {
    if (m == account) return group_line;
  }
  size_t last_colon = group_line.rfind(':');
  return group_line.substr(0, last_colon + 1) + (members.empty() ? "" : members + ",") + account;
}

}  // namespace

bool KIVOAccountCheckPassword(const std::string& account, const std::string& password) {
  std::string hash = KIVOAccountNameValid(account) ? StoredHash(account) : "";
  bool usable = IsUsableHash(hash);
  // A name that cannot sign in costs the same hashing as one that can, so the
  // time of the answer does not tell which accounts exist.
  std::string setting = usable ? hash : StandInSetting();
  struct crypt_data data;
  memset(&data, 0, sizeof(data));
  const char* computed = CryptR(password, setting.c_str(), &data);
  return usable && computed && computed[0] != '*' && hash == computed;
}

bool KIVOAccountInGroup(const std::string& account, const std::string& group) {
  gid_t primary = static_cast<gid_t>(-1);
  UniqueFile pw = OpenRootFile("/etc/passwd");
  for (struct passwd* p; pw && (p = fgetpwent(pw.get()));) {
    if (account == p->pw_name) primary = p->pw_gid;
  }
  UniqueFile gr = OpenRootFile("/etc/group");
  for (struct group* g; gr && (g = fgetgrent(gr.get()));) {
    if (group != g->gr_name) continue;
    if (g->gr_gid == primary) return true;
    for (char** m = g->gr_mem; m && *m; ++m) {
      if (account == *m) return true;
    }
  }
  return false;
}

bool KIVOAccountSet(const std::string& account, const std::string& password,
                    const std::vector<std::string>& groups, std::string* error) {
  if (!KIVOAccountNameValid(account)) return (*error = "invalid account name: " + account), false;
  for (const std::string& g : groups) {
    if (!KIVOAccountNameValid(g)) return (*error = "invalid group name: " + g), false;
  }
  std::string hash = HashPassword(password);
  if (hash.empty()) return (*error = "cannot hash the password"), false;

  FileLock lock(KIVOAccountsLockPath());
  if (!lock.held()) return (*error = "cannot lock the account files"), false;
  std::vector<std::string> passwd = ReadLines("/etc/passwd");
  std::vector<std::string> shadow = ReadLines("/etc/shadow");
  std::vector<std::string> group = ReadLines("/etc/group");
  std::string uid;
  for (const std::string& l : passwd) {
    if (FieldOf(l, 0) == account) uid = FieldOf(l, 2);
  }
  if (uid.empty()) uid = std::to_string(NextFreeId(passwd, 1024));
  Upsert(&passwd, account,
         account + ":x:" + uid + ":100::/var/services/homes/" + account + ":/sbin/nologin");
  Upsert(&shadow, account, account + ":" + hash + ":0:0:99999:7:::");
  for (const std::string& g : groups) {
    std::string line = g + ":x:" + std::to_string(NextFreeId(group, 1024)) + ":";
    for (const std::string& l : group) {
      if (FieldOf(l, 0) == g) line = l;
    }
    Upsert(&group, g, AddMember(line, account));
  }
  if (!WriteLines("/etc/group", group, 0644) || !WriteLines("/etc/shadow", shadow, 0600) ||
      !WriteLines("/etc/passwd", passwd, 0644)) {
    *error = "cannot write the account files under " + KIVORootPath("/etc");
    return false;
  }
  return true;
}
