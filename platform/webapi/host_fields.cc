#include "webapi/host_fields.h"

namespace {
constexpr char kStoredPathSuffix[] = "_tmp";
constexpr size_t kSuffixLength = sizeof(kStoredPathSuffix) - 1;
}  // namespace

bool IsHostField(const std::string& name) {
  if (name == "file_name") return true;
  return name.size() >= kSuffixLength &&
         name.compare(name.size() - kSuffixLength, kSuffixLength, kStoredPathSuffix) == 0;
}
