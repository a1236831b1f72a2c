// The back-off that makes password guessing slow: failed sign-ins are
// counted per client address and per account, on disk under the system root
// ("/run/kivo/login-throttle.json", guarded by "/run/kivo/login-throttle.lock"),
// because every request is a process of its own.
//
// Counting.
//  - An attempt is counted as a failure before its password is checked and
//    forgotten again when it succeeds, so sign-ins that race each other
//    cannot all slip through before the first failure is written.
//  - An address may fail `free_failures` times; after that each further
//    attempt has to wait backoff_base * 2^(failures - free_failures) seconds
//    after the previous one, at most `backoff_max`.
//  - An account is throttled the same way by the number of distinct
//    addresses that failed on it, so that guessing spread over many addresses
//    slows down too, while one address alone can never lock an account: it
//    only ever throttles itself, and the account's owner signs in from
//    another address as usual.
//  - A refused attempt is not counted (waiting does not grow the wait).
//  - A success forgets the account's record and the address's failures on
//    that account (not its failures on other accounts, so signing in to an
//    account of one's own does not buy more guesses at another), and gives
//    the address back the wait it had before the attempt: on a shared
//    address a right password never makes the next person wait again.
//  - Records quiet for a day are forgotten; the file's size is bounded.
#pragma once

#include <string>

struct LoginLimits {
  long free_failures = 5;
  long backoff_base = 1;   // seconds
  long backoff_max = 900;  // seconds
};

enum class LoginAdmission {
  Admitted,     // go on and check the password; the attempt is counted
  Throttled,    // refused; *retry_after_seconds says when to try again
  Unavailable,  // the attempt cannot be recorded: refuse the sign-in
};

class LoginThrottle {
 public:
  explicit LoginThrottle(LoginLimits limits);

  // Decides whether `account` may be tried from `address` now and, when it
  // may, counts the attempt as a failure. `account` is counted per account
  // only when it has the shape of an account name (existing or not, so the
  // answer tells nothing about which accounts exist).
  [[nodiscard]] LoginAdmission Admit(const std::string& account, const std::string& address,
                                     long* retry_after_seconds);
  // After a wrong password: the wait starts from now rather than from when
  // Admit counted the attempt. False when the state cannot be written.
  [[nodiscard]] bool Failed(const std::string& account, const std::string& address);
  // Forgets what Admit counted for a sign-in that succeeded. False when the
  // state cannot be written (the attempt then stays counted).
  // REQUIRES: Admit admitted this attempt on this object.
  [[nodiscard]] bool Succeeded(const std::string& account, const std::string& address);

  // What Admit changed, for Succeeded to undo.
  struct Admission {
    long long admitted_at_ms = -1;
    long long address_last_before_ms = -1;  // -1: the address had no record
  };

 private:
  LoginLimits limits_;
  Admission admission_;
  std::string state_path_;
  std::string lock_path_;
};

// The key a client address is counted under: an IPv4 address as it is (also
// when it comes IPv4-mapped), an IPv6 address by its /64 prefix (one
// subscriber usually holds a whole /64), anything else "unknown".
std::string LoginAddressKey(const char* remote_addr);
