#include "host/session_store.h"

#include <algorithm>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/hex.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

#include <time.h>

namespace {

constexpr size_t kIdBytes = 16;
// Guards the per-account limit: held from writing a new session until the
// account's oldest ones beyond the limit are gone. (Not an id, so never
// taken for a session.)
constexpr char kLockName[] = ".lock";
// A used session's file time is refreshed at most this often, so most
// requests only read.
constexpr long kTouchInterval = 30;

}  // namespace

SessionStore::SessionStore(SessionLimits limits)
    : limits_(limits), dir_(KIVORootPath("/run/kivo/sessions")) {}

bool SessionStore::IsWellFormedId(const std::string& id) {
  return id.size() == 2 * kIdBytes && KIVOIsLowerHex(id);
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

void SessionStore::EndOldestOf(const std::string& user) {
  // (creation in nanoseconds, id) of each of the user's sessions.
  std::vector<std::pair<long long, std::string>> sessions;
  DIR* dir = opendir(dir_.c_str());
  if (!dir) return;
  while (struct dirent* entry = readdir(dir)) {
    KeyValueMap fields;
    if (!IsWellFormedId(entry->d_name) || !KIVOKeyValueLoad(PathOf(entry->d_name), &fields) ||
        fields["user"] != user) {
      continue;
    }
    sessions.emplace_back(std::strtoll(fields["created_ns"].c_str(), nullptr, 10), entry->d_name);
  }
  closedir(dir);
  if (sessions.size() <= static_cast<size_t>(limits_.max_per_account)) return;
  std::sort(sessions.begin(), sessions.end());
  size_t excess = sessions.size() - static_cast<size_t>(limits_.max_per_account);
  for (size_t i = 0; i < excess; ++i) unlink(PathOf(sessions[i].second).c_str());
}

bool SessionStore::Create(const std::string& user, Session* out) {
  RemoveExpired();
  if (!KIVORandomHex(kIdBytes, &out->id) || !KIVORandomHex(kIdBytes, &out->token)) return false;
  out->user = user;
  if (KIVOFSMkdirP(dir_.c_str(), 0700) != 0) return false;
  FileLock lock(dir_ + "/" + kLockName);
  if (!lock.held()) return false;
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  long long now_ns = static_cast<long long>(now.tv_sec) * 1000000000LL + now.tv_nsec;
  std::string content = KIVOKeyValueLine("user", user) + "\n" +
                        KIVOKeyValueLine("token", out->token) + "\n" +
                        KIVOKeyValueLine("created", std::to_string(now.tv_sec)) + "\n" +
                        KIVOKeyValueLine("created_ns", std::to_string(now_ns)) + "\n";
  if (!KIVOWriteFileAtomic(PathOf(out->id), content, SyncToDisk::No, 0600)) return false;
  EndOldestOf(user);
  return true;
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
