#include "settings/web_utils.h"

#include <memory>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/last_error.h"

namespace WebUtils {

bool LoadJsonFile(const std::string& path, Json::Value& out) {
  out = Json::Value();
  std::string text;
  if (!KIVOReadFile(path, &text)) return false;
  // Files hold an object or an array, never a bare value.
  if (!KIVOParseJson(text, &out) || !(out.isObject() || out.isArray())) {
    out = Json::Value();
    KLIBCErrSet(KLIBC_ERR_FILE_READ);
    return false;
  }
  return true;
}

bool SaveJsonFile(const std::string& path, const Json::Value& value) {
  size_t slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0 && KIVOFSMkdirP(path.substr(0, slash).c_str()) != 0) {
    return false;
  }
  return KIVOWriteFileAtomic(path, KIVOWriteJson(value, "  ") + "\n");
}

}  // namespace WebUtils
