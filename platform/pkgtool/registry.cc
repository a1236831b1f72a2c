#include "pkgtool/registry.h"

#include <sys/stat.h>

#include <cctype>
#include <sstream>

#include "klibc/sysroot.h"

namespace PackageRegistry {

std::string Dir() { return KIVORootPath("/var/packages"); }

std::string RecordDir(const std::string& id) { return Dir() + "/" + id; }

bool IsInstalled(const std::string& id) {
  struct stat st;
  return PMSIsValidPackageId(id) && stat((RecordDir(id) + "/INFO").c_str(), &st) == 0 &&
         S_ISREG(st.st_mode);
}

bool ReadInfo(const std::string& id, KeyValueMap* info) {
  return PMSIsValidPackageId(id) && KIVOKeyValueLoad(RecordDir(id) + "/INFO", info);
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
