#include "host/login_throttle.h"

#include <algorithm>
#include <climits>
#include <cstring>
#include <functional>
#include <syslog.h>

#include <json/value.h>

#include "accounts/accounts.h"
#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/json_text.h"
#include "klibc/sysroot.h"
#include "settings/web_utils.h"

#include <arpa/inet.h>
#include <time.h>

namespace {

// The state file:
//   {"addresses": {ADDR: {"last": MS, "failures": {ACCOUNT: N, ...}}},
//    "accounts":  {ACCOUNT: {"last": MS, "addresses": {ADDR: MS, ...}}}}
// ACCOUNT "" gathers the failures on names that are not account names.
constexpr char kAddresses[] = "addresses";
constexpr char kAccounts[] = "accounts";
constexpr char kLast[] = "last";
constexpr char kFailures[] = "failures";

// Larger settings (a back-off beyond a day, more free failures than a day has
// seconds) mean nothing more and would overflow the arithmetic.
constexpr long kMaxSetting = 86400;
constexpr long long kForgetAfterMs = 24LL * 3600 * 1000;
// Bounds that keep the file small whatever an attacker sends.
constexpr unsigned kMaxAddresses = 4096;
constexpr unsigned kMaxAccounts = 4096;
constexpr unsigned kMaxAccountsPerAddress = 16;
constexpr unsigned kMaxAddressesPerAccount = 64;

long long NowMs() {
  struct timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// The file is ours, but a damaged one must not throw: a value that is not a
// whole number reads as 0.
long long IntOf(const Json::Value& v) { return v.isInt64() ? v.asInt64() : 0; }

long long LastOf(const Json::Value& record) {
  return std::clamp(IntOf(record[kLast]), 0LL, 1LL << 50);  // keeps sums in range
}

// Drops members that are not objects, and makes `field` of each an object.
void KeepObjects(Json::Value* map, const char* field) {
  for (const std::string& key : map->getMemberNames()) {
    Json::Value& record = (*map)[key];
    if (!record.isObject()) {
      map->removeMember(key);
    } else if (!record[field].isObject()) {
      record[field] = Json::Value(Json::objectValue);
    }
  }
}

// Removes the oldest members of `map` (by their "last", or their own value
// when it is a number) until it holds at most `max`.
void KeepNewest(Json::Value* map, unsigned max) {
  while (map->size() > max) {
    std::string oldest;
    long long oldest_ms = LLONG_MAX;
    for (const std::string& key : map->getMemberNames()) {
      const Json::Value& v = (*map)[key];
      long long ms = v.isObject() ? LastOf(v) : IntOf(v);
      if (ms <= oldest_ms) oldest = key, oldest_ms = ms;
    }
    map->removeMember(oldest);
  }
}

void ForgetQuiet(Json::Value* map, long long now) {
  for (const std::string& key : map->getMemberNames()) {
    if (now - LastOf((*map)[key]) > kForgetAfterMs) map->removeMember(key);
  }
}

long long AddressFailures(const Json::Value& address) {
  long long sum = 0;
  for (const Json::Value& n : address[kFailures]) sum += std::clamp(IntOf(n), 0LL, 1LL << 32);
  return sum;
}

class ThrottleState {
 public:
  ThrottleState(const LoginLimits& limits, long long now) : limits_(limits), now_(now) {}

  // A missing or damaged file is an empty state: the file is ours alone and
  // the next write replaces it.
  void Load(const std::string& path) {
    if (!WebUtils::LoadJsonFile(path, state_) || !state_.isObject()) {
      if (KLIBCFileExist(path.c_str()))
        syslog(LOG_WARNING, "%s:%d unreadable %s, starting afresh", "login_throttle", __LINE__,
               path.c_str());
      state_ = Json::Value(Json::objectValue);
    }
    for (const char* part : {kAddresses, kAccounts}) {
      if (!state_[part].isObject()) state_[part] = Json::Value(Json::objectValue);
      KeepObjects(&state_[part], part == kAddresses ? kFailures : kAddresses);
      ForgetQuiet(&state_[part], now_);
    }
  }

  bool Save(const std::string& path) const {
    // The file lives in the run folder and is rebuilt by failures alone, so
    // it is not worth a sync to disk at every sign-in.
    return KIVOWriteFileAtomic(path, KIVOWriteJson(state_), SyncToDisk::No, 0600);
  }

  // Milliseconds until `address` and `account` may be tried; 0 when now.
  long long WaitMs(const std::string& account, const std::string& address) const {
    long long wait = WaitAfter(state_[kAddresses][address], AddressFailures);
    if (account.empty()) return wait;
    return std::max(wait, WaitAfter(state_[kAccounts][account], [](const Json::Value& a) {
                      return static_cast<long long>(a[kAddresses].size());
                    }));
  }

  // Returns when the address's wait started before this attempt (-1 when it
  // had no record), for a success to give it back.
  long long CountFailure(const std::string& account, const std::string& address) {
    Json::Value& addresses = state_[kAddresses];
    const long long before = addresses.isMember(address) ? LastOf(addresses[address]) : -1;
    Json::Value& a = addresses[address];
    a[kLast] = Json::Int64(now_);
    Json::Value& failures = a[kFailures];
    if (!failures.isMember(account) && failures.size() >= kMaxAccountsPerAddress) {
      // Too many names from one address: the rest are counted together.
      failures[""] = Json::Int64(IntOf(failures[""]) + 1);
    } else {
      failures[account] = Json::Int64(IntOf(failures[account]) + 1);
    }
    KeepNewest(&state_[kAddresses], kMaxAddresses);
    if (!account.empty()) {
      Json::Value& acc = state_[kAccounts][account];
      acc[kLast] = Json::Int64(now_);
      acc[kAddresses][address] = Json::Int64(now_);
      KeepNewest(&acc[kAddresses], kMaxAddressesPerAccount);
      KeepNewest(&state_[kAccounts], kMaxAccounts);
    }
    return before;
  }

  // Starts the waits of `address` and `account` anew: a failure is known
  // only once its password has been checked, a while after it was counted.
  void StampFailure(const std::string& account, const std::string& address) {
    Json::Value& addresses = state_[kAddresses];
    if (addresses.isMember(address)) addresses[address][kLast] = Json::Int64(now_);
    Json::Value& accounts = state_[kAccounts];
    if (!account.empty() && accounts.isMember(account))
      accounts[account][kLast] = Json::Int64(now_);
  }

  // A success: forgets the attempt that `admission` counted and, when no
  // other attempt came since, gives the address back the wait it had, so a
  // right password never makes the next person on that address wait longer.
  void ForgetFailures(const std::string& account, const std::string& address,
                      const LoginThrottle::Admission& admission) {
    state_[kAccounts].removeMember(account);
    Json::Value& a = state_[kAddresses][address];
    a[kFailures].removeMember(account);
    if (AddressFailures(a) == 0) {
      state_[kAddresses].removeMember(address);
    } else if (admission.address_last_before_ms >= 0 && LastOf(a) == admission.admitted_at_ms) {
      a[kLast] = Json::Int64(admission.address_last_before_ms);
    }
  }

  long long now() const { return now_; }

 private:
  // The wait a record imposes: none for its first free failures, then the
  // base doubled per failure beyond them, capped.
  template <typename CountFn>
  long long WaitAfter(const Json::Value& record, CountFn count_of) const {
    if (!record.isObject()) return 0;
    long long beyond = count_of(record) - limits_.free_failures;
    if (beyond < 0) return 0;
    const long long cap_ms = limits_.backoff_max * 1000LL;
    long long delay_ms = limits_.backoff_base * 1000LL;
    for (long long i = 0; i < beyond && delay_ms < cap_ms; ++i) delay_ms *= 2;
    delay_ms = std::min(delay_ms, cap_ms);
    // Clamped, so that a clock set back cannot make the wait longer.
    return std::clamp(LastOf(record) + delay_ms - now_, 0LL, delay_ms);
  }

  const LoginLimits& limits_;
  long long now_;
  Json::Value state_;
};

// Applies `change` to the state under the lock and writes it back.
bool UpdateState(const LoginLimits& limits, const std::string& lock_path,
                 const std::string& state_path, const std::function<void(ThrottleState*)>& change) {
  FileLock lock(lock_path);
  if (!lock.held()) return false;
  ThrottleState state(limits, NowMs());
  state.Load(state_path);
  change(&state);
  return state.Save(state_path);
}

}  // namespace

LoginThrottle::LoginThrottle(LoginLimits limits)
    : limits_{std::min(limits.free_failures, kMaxSetting),
              std::min(limits.backoff_base, kMaxSetting),
              std::min(limits.backoff_max, kMaxSetting)},
      state_path_(KIVORootPath("/run/kivo/login-throttle.json")),
      lock_path_(KIVORootPath("/run/kivo/login-throttle.lock")) {}

LoginAdmission LoginThrottle::Admit(const std::string& account, const std::string& address,
                                    long* retry_after_seconds) {
  *retry_after_seconds = 0;
  if (KIVOFSMkdirP(KIVORootPath("/run/kivo").c_str(), 0755) != 0)
    return LoginAdmission::Unavailable;
  FileLock lock(lock_path_);
  if (!lock.held()) return LoginAdmission::Unavailable;
  ThrottleState state(limits_, NowMs());
  state.Load(state_path_);
  const std::string name = KIVOAccountNameValid(account) ? account : "";
  long long wait_ms = state.WaitMs(name, address);
  if (wait_ms > 0) {
    *retry_after_seconds = static_cast<long>((wait_ms + 999) / 1000);
    return LoginAdmission::Throttled;
  }
  admission_.admitted_at_ms = state.now();
  admission_.address_last_before_ms = state.CountFailure(name, address);
  return state.Save(state_path_) ? LoginAdmission::Admitted : LoginAdmission::Unavailable;
}

bool LoginThrottle::Failed(const std::string& account, const std::string& address) {
  const std::string name = KIVOAccountNameValid(account) ? account : "";
  return UpdateState(limits_, lock_path_, state_path_,
                     [&](ThrottleState* state) { state->StampFailure(name, address); });
}

bool LoginThrottle::Succeeded(const std::string& account, const std::string& address) {
  return UpdateState(limits_, lock_path_, state_path_, [&](ThrottleState* state) {
    state->ForgetFailures(account, address, admission_);
  });
}

std::string LoginAddressKey(const char* remote_addr) {
  if (!remote_addr) return "unknown";
  unsigned char bytes[16];
  char text[INET6_ADDRSTRLEN];
  if (inet_pton(AF_INET, remote_addr, bytes) == 1) {
    return inet_ntop(AF_INET, bytes, text, sizeof(text)) ? text : "unknown";
  }
  if (inet_pton(AF_INET6, remote_addr, bytes) != 1) return "unknown";
  static const unsigned char kMapped[12] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff};
  if (memcmp(bytes, kMapped, sizeof(kMapped)) == 0) {
    return inet_ntop(AF_INET, bytes + 12, text, sizeof(text)) ? text : "unknown";
  }
  memset(bytes + 8, 0, 8);
  if (!inet_ntop(AF_INET6, bytes, text, sizeof(text))) return "unknown";
  return std::string(text) + "/64";
}
