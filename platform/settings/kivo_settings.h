// Per-user settings of the web desktop's applications: one JSON document per
// account, "/usr/kivo/etc/users/<name>/settings.json" under the system root,
// each application keeping its own object under its own key.
//
// Writes replace the whole document atomically (temporary file + rename), so
// a reader sees the old or the new document, never half of one. Two plain
// saves of the same user's document do not merge: the later rename wins.
// Writers that change only their own members use updateUserJsonSettings,
// which holds the document's lock from the read to the rename.
#pragma once

#include <functional>
#include <string>

#include <json/value.h>

class KivoSettings {
 public:
  // `user` is the account the settings belong to. A name that is not a
  // valid account name never becomes a path: every call then fails.
  explicit KivoSettings(const std::string& user);

  // The user's document: an empty object when the user has none yet. False
  // (with `settings` null and the last error set) when the user name is not
  // valid, or the document cannot be read or is not a JSON object.
  [[nodiscard]] bool loadUserJsonSettings(Json::Value& settings) const;
  // Replaces the user's document with `settings` (an object). False with the
  // last error set on an invalid user name, a value that is not an object, or
  // a failed write; the old document is then left as it was.
  [[nodiscard]] bool saveUserJsonSettings(const Json::Value& settings) const;
  // Reads the document, lets `change` edit it and saves it, all under the
  // lock file "settings.json.lock" beside it, so that concurrent updates of
  // different members all survive. `change` answers false to leave the
  // document unwritten. False (last error set) when the lock, the read or
  // the save fails, or when `change` refused.
  [[nodiscard]] bool updateUserJsonSettings(const std::function<bool(Json::Value&)>& change) const;

  // The document's path, "" when the user name is not valid.
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};
