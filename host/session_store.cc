#include "host/session_store.h"

#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

namespace {

constexpr size_t kIdBytes = 16;
// A used session's file time is refreshed at most this often, so most
// requests only read.
constexpr long kTouchInterval = 30;

bool RandomHex(size_t bytes, std::string* out) {
  unsigned char buf[32];
  if (bytes > sizeof(buf) || getrandom(buf, bytes, 0) != static_cast<ssize_t>(bytes)) return false;
  static const char kHex[] = "0123456789abcdef";
  out->clear();
  for (size_t i = 0; i < bytes; ++i) {
    *out += kHex[buf[i] >> 4];
    *out += kHex[buf[i] & 15];
  }
  return true;
}

}  // namespace

SessionStore::SessionStore(SessionLimits limits)
    : limits_(limits), dir_(KIVORootPath("/run/kivo/sessions")) {}

bool SessionStore::IsWellFormedId(const std::string& id) {
  return id.size() == 2 * kIdBytes && id.find_first_not_of("0123456789abcdef") == std::string::npos;
}

std::string SessionStore::PathOf(const std::string& id) const { return dir_ + "/" + id; }

void SessionStore::RemoveExpired() {
  DIR* dir = opendir(dir_.c_str());
  if (!dir) return;
  time_t now = time(nullptr);
  while (struct dirent* entry = readdir(dir)) {
    struct stat st;
    if (!IsWellFormedId(entry->d_name)) continue;
    std::string path = PathOf(entry->d_name);
    // The creation time is inside the file; the idle limit alone is enough to
    // reclaim what nobody uses any more.
    if (stat(path.c_str(), &st) == 0 && now - st.st_mtime > limits_.idle_timeout)
      unlink(path.c_str());
  }
  closedir(dir);
}

bool SessionStore::Create(const std::string& user, Session* out) {
  RemoveExpired();
  if (!RandomHex(kIdBytes, &out->id) || !RandomHex(kIdBytes, &out->token)) return false;
  out->user = user;
  if (KIVOFSMkdirP(dir_.c_str(), 0700) != 0) return false;
  std::string content = KIVOKeyValueLine("user", user) + "\n" +
                        KIVOKeyValueLine("token", out->token) + "\n" +
                        KIVOKeyValueLine("created", std::to_string(time(nullptr))) + "\n";
  return KIVOWriteFileAtomic(PathOf(out->id), content, SyncToDisk::No, 0600);
}

SessionLookup SessionStore::Find(const std::string& id, Session* out) {
  if (!IsWellFormedId(id)) return SessionLookup::Unknown;
  std::string path = PathOf(id);
  struct stat st;
  KeyValueMap fields;
  if (stat(path.c_str(), &st) != 0 || !KIVOKeyValueLoad(path, &fields))
    return SessionLookup::Unknown;
  time_t now = time(nullptr);
  long created = std::strtol(fields["created"].c_str(), nullptr, 10);
  if (now - st.st_mtime > limits_.idle_timeout || now - created > limits_.max_age) {
    unlink(path.c_str());
    return SessionLookup::Expired;
  }
  if (now - st.st_mtime > kTouchInterval) utimensat(AT_FDCWD, path.c_str(), nullptr, 0);
  out->id = id;
  out->user = fields["user"];
  out->token = fields["token"];
  return out->user.empty() ? SessionLookup::Unknown : SessionLookup::Found;
}

void SessionStore::Remove(const std::string& id) {
  if (IsWellFormedId(id)) unlink(PathOf(id).c_str());
}

bool ConstantTimeEquals(const std::string& a, const std::string& b) {
  if (a.size() != b.size()) return false;
  unsigned char diff = 0;
  for (size_t i = 0; i < a.size(); ++i) diff |= static_cast<unsigned char>(a[i] ^ b[i]);
  return diff == 0;
}
