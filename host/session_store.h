// Signed-in sessions: one small file per session under "/run/kivo/sessions"
// of the system root, named after the session id.
//
// A session id and its CSRF token are 128 random bits each (hex). A session
// expires when it has not been used for `idle_timeout` seconds (its file's
// modification time is the last use) or when it is older than `max_age`. An
// account holds at most `max_per_account` sessions: a sign-in beyond that
// ends the account's oldest ones, so repeated sign-ins cannot pile up files.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>

struct Session {
  std::string id;
  std::string user;
  std::string token;
};

struct SessionLimits {
  long idle_timeout = 1800;
  long max_age = 86400;
  long max_per_account = 16;
};

enum class SessionLookup { Found, Unknown, Expired };

class SessionStore {
 public:
  explicit SessionStore(SessionLimits limits);

  // Creates a session for `user` and ends its oldest sessions beyond the
  // limit. Sign-ins that race are serialized by a lock file in the sessions
  // folder. False when the session cannot be stored.
  [[nodiscard]] bool Create(const std::string& user, Session* out);
  // Finds a live session and marks it used. An expired one is removed.
  SessionLookup Find(const std::string& id, Session* out);
  void Remove(const std::string& id);

  // True when `id` has the shape of a session id (so it is safe as a file name).
  static bool IsWellFormedId(const std::string& id);

 private:
  std::string PathOf(const std::string& id) const;
  // Deletes the files of sessions idle for longer than the limit; run at each
  // sign-in so that abandoned sessions do not pile up.
  void RemoveExpired();
  // Ends the oldest sessions of `user` until it holds at most the limit.
  // REQUIRES: the sessions folder's lock is held.
  void EndOldestOf(const std::string& user);

  SessionLimits limits_;
  std::string dir_;
};

// Compares without an early exit, so timing does not tell how much matched.
bool ConstantTimeEquals(const std::string& a, const std::string& b);
