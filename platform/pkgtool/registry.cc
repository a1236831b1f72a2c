#include "pkgtool/registry.h"

#include <algorithm>
#include <cctype>
#include <dirent.h>
#include <sstream>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

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
  char buf[512];
  ssize_t n = readlink(RecordDir(id).c_str(), buf, sizeof(buf) - 1);
  if (n <= 0) return "";
  return std::string(buf, static_cast<size_t>(n));
}

bool Publish(const std::string& id, const std::string& record) {
  std::string tmp = Dir() + "/.publish-" + id;
  unlink(tmp.c_str());
  if (symlink(record.c_str(), tmp.c_str()) != 0) return false;
  if (rename(tmp.c_str(), RecordDir(id).c_str()) != 0) {
    unlink(tmp.c_str());
    return false;
  }
  // The rename is the commit; make it survive a power cut as well.
  if (DIR* d = opendir(Dir().c_str())) {
    fsync(dirfd(d));
    closedir(d);
  }
  return true;
}

bool Unpublish(const std::string& id) {
  bool ok = unlink(RecordDir(id).c_str()) == 0;
  if (DIR* d = opendir(Dir().c_str())) {
    fsync(dirfd(d));
    closedir(d);
  }
  return ok;
}

std::string NewRecordName(const std::string& id) {
  unsigned char bytes[6];
  if (getrandom(bytes, sizeof(bytes), 0) != sizeof(bytes)) return "";
  static const char kHex[] = "0123456789abcdef";
  std::string name = id + ".";
  for (unsigned char b : bytes) {
    name += kHex[b >> 4];
    name += kHex[b & 15];
  }
  return name;
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
