#include "klibc/key_value_file.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <sstream>

#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"

namespace {

bool IsValidKey(const std::string& key) {
  if (key.empty()) return false;
  for (char c : key) {
    if (!isalnum(static_cast<unsigned char>(c)) && c != '_' && c != '.' && c != '-') return false;
  }
  return true;
}

std::string Trim(const std::string& s) {
  size_t b = s.find_first_not_of(" \t\r");
  if (b == std::string::npos) return "";
  size_t e = s.find_last_not_of(" \t\r");
  return s.substr(b, e - b + 1);
}

std::string Unquote(const std::string& raw) {
  if (raw.size() < 2 || raw.front() != '"' || raw.back() != '"') return raw;
  std::string out;
  for (size_t i = 1; i + 1 < raw.size(); ++i) {
    if (raw[i] == '\\' && i + 2 < raw.size()) ++i;
    out += raw[i];
  }
  return out;
}

// Splits one line; false for comments, blank lines and lines without '='.
bool ParseLine(const std::string& line, std::string* key, std::string* value) {
  std::string t = Trim(line);
  if (t.empty() || t[0] == '#') return false;
  size_t eq = t.find('=');
  if (eq == std::string::npos) return false;
  *key = Trim(t.substr(0, eq));
  *value = Unquote(Trim(t.substr(eq + 1)));
  return !key->empty();
}

}  // namespace

KeyValueMap KIVOKeyValueParse(const std::string& text) {
  // Every package's INFO passes through here on each list; split lines by
  // hand rather than through a stream.
  KeyValueMap out;
  std::string line, key, value;
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    line.assign(text, start, end - start);
    if (ParseLine(line, &key, &value)) out[std::move(key)] = std::move(value);
    start = end + 1;
  }
  return out;
}

bool KIVOKeyValueLoad(const std::string& path, KeyValueMap* out) {
  std::string text;
  if (!KIVOReadFile(path, &text)) return false;
  *out = KIVOKeyValueParse(text);
  return true;
}

std::string KIVOKeyValueLine(const std::string& key, const std::string& value) {
  std::string line = key + "=\"";
  for (char c : value) {
    if (c == '"' || c == '\\') line += '\\';
    line += c;
  }
  return line + "\"";
}

bool KIVOKeyValueSet(const std::string& path, const std::string& key, const std::string& value) {
  if (!IsValidKey(key) || value.find_first_of("\r\n") != std::string::npos) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  FileLock lock(path + ".lock");
  if (!lock.held()) {
    KLIBCErrSet(KLIBC_ERR_LOCK);
    return false;
  }
  std::string text;
  if (!KIVOReadFile(path, &text) && KLIBCErrGet() != KLIBC_ERR_NOT_FOUND) return false;

  std::istringstream in(text);
  std::string line, k, v, result;
  bool replaced = false;
  while (std::getline(in, line)) {
    if (ParseLine(line, &k, &v) && k == key) {
      if (replaced) continue;  // Drop duplicates: one key, one line.
      line = KIVOKeyValueLine(key, value);
      replaced = true;
    }
    result += line + "\n";
  }
  if (!replaced) result += KIVOKeyValueLine(key, value) + "\n";
  return KIVOWriteFileAtomic(path, result);
}

int KLIBCFileGetKeyValue(const char* file, const char* key, char* buf, int size, int flags) {
  if (!file || !key || !buf || size <= 0) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  buf[0] = '\0';
  KeyValueMap map;
  if (!KIVOKeyValueLoad(file, &map)) return -1;
  auto it = map.find(key);
  if (it == map.end()) return 0;
  size_t n = std::min(it->second.size(), static_cast<size_t>(size - 1));
  memcpy(buf, it->second.data(), n);
  buf[n] = '\0';
  return static_cast<int>(n);
}

int KLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int flags) {
  if (!file || !key || !value) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  KeyValueMap map;
  if (!KIVOKeyValueLoad(file, &map)) return -1;
  auto it = map.find(key);
  return it != map.end() && it->second == value ? 1 : 0;
}

int KLIBCINFOSetKeyValue(const char* key, const char* value) {
  if (!key || !value) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  return KIVOKeyValueSet(KIVORootPath("/etc/kivoinfo.conf"), key, value) ? 0 : -1;
}
