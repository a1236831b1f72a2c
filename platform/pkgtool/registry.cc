#include "pkgtool/registry.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <dirent.h>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/hex.h"
#include "klibc/sysroot.h"

namespace PackageRegistry {

std::string Dir() { return KIVORootPath("/var/packages"); }

std::string RecordDir(const std::string& id) { return Dir() + "/" + id; }

std::string RecordsDir() { return Dir() + "/.records"; }

bool IsInstalled(const std::string& id) {
  struct stat st;
  return PMSIsValidPackageId(id) && stat((RecordDir(id) + "/INFO").c_str(), &st) == 0 &&
         S_ISREG(st.st_mode);
}

bool ReadInfo(const std::string& id, KeyValueMap* info) {
  return PMSIsValidPackageId(id) && KIVOKeyValueLoad(RecordDir(id) + "/INFO", info);
}

std::vector<std::string> List() {
  std::vector<std::string> ids;
  DIR* d = opendir(Dir().c_str());
  if (!d) return ids;
  while (struct dirent* e = readdir(d)) {
    if (e->d_name[0] != '.' && IsInstalled(e->d_name)) ids.push_back(e->d_name);
  }
  closedir(d);
  std::sort(ids.begin(), ids.end());
  return ids;
}

std::string PublishedRecord(const std::string& id) {
  if (!PMSIsValidPackageId(id)) return "";
  char buf[512];
  ssize_t n = readlink(RecordDir(id).c_str(), buf, sizeof(buf) - 1);
  if (n <= 0) return "";
  return std::string(buf, static_cast<size_t>(n));
}

bool IsRecordNameOf(const std::string& id, const std::string& record) {
  const std::string prefix = ".records/" + id + ".";
  return PMSIsValidPackageId(id) && record.size() > prefix.size() &&
         record.compare(0, prefix.size(), prefix) == 0 &&
         PMSIsStrictlyInside(Dir() + "/" + record, RecordsDir()) &&
         record.find('/', prefix.size()) == std::string::npos;
}

std::string PublishedRecordPath(const std::string& id) {
  std::string record = PublishedRecord(id);
  return IsRecordNameOf(id, record) ? Dir() + "/" + record : "";
}

namespace {

// Makes a change of the registry folder's names survive a power cut.
void SyncDir() {
  if (DIR* d = opendir(Dir().c_str())) {
    fsync(dirfd(d));
    closedir(d);
  }
}

}  // namespace

bool Publish(const std::string& id, const std::string& record) {
  if (!IsRecordNameOf(id, record)) {
    errno = EINVAL;
    return false;
  }
  std::string tmp = Dir() + "/.publish-" + id;
  unlink(tmp.c_str());
  if (symlink(record.c_str(), tmp.c_str()) != 0) return false;
  // The rename is the commit.
  if (rename(tmp.c_str(), RecordDir(id).c_str()) != 0) {
    int saved = errno;
    unlink(tmp.c_str());
    errno = saved;
    return false;
  }
  SyncDir();
  return true;
}

bool Unpublish(const std::string& id) {
  if (!PMSIsValidPackageId(id)) {
    errno = EINVAL;
    return false;
  }
  if (unlink(RecordDir(id).c_str()) != 0) return false;
  SyncDir();
  return true;
}

std::string NewRecordName(const std::string& id) {
  std::string nonce;
  return KIVORandomHex(6, &nonce) ? id + "." + nonce : "";
}

}  // namespace PackageRegistry

bool PMSIsValidPackageId(const std::string& id) {
  if (id.empty() || id.size() > 64 || !isalnum(static_cast<unsigned char>(id[0]))) return false;
  for (char c : id) {
    if (!isalnum(static_cast<unsigned char>(c)) && c != '.' && c != '_' && c != '+' && c != '-') {
      return false;
    }
  }
  return true;
}

bool PMSIsContainedRelativePath(const std::string& rel) {
  if (rel.empty() || rel[0] == '/') return false;
  std::istringstream in(rel);
  for (std::string part; std::getline(in, part, '/');) {
    if (part.empty() || part == "." || part == "..") return false;
  }
  return rel.back() != '/';
}

bool PMSIsStrictlyInside(const std::string& path, const std::string& owner) {
  if (owner.empty() || owner[0] != '/' || owner.back() == '/') return false;
  return path.size() > owner.size() + 1 && path.compare(0, owner.size(), owner) == 0 &&
         path[owner.size()] == '/' && PMSIsContainedRelativePath(path.substr(owner.size() + 1));
}

bool PMSSymlinkStaysInside(const std::string& path, const std::string& target) {
  if (target.empty() || target[0] == '/') return false;
  int depth = static_cast<int>(std::count(path.begin(), path.end(), '/'));
  std::istringstream in(target);
  for (std::string part; std::getline(in, part, '/');) {
    if (part == "..") {
      if (--depth < 0) return false;
    } else if (!part.empty() && part != ".") {
      ++depth;
    }
  }
  return true;
}
