// One package operation's record: the operation log (everything the tool and
// the package's scripts said), the worker messages scripts leave for the
// user, and the result parameters a caller reads afterwards. The log lives in
// "/var/log/packages" under the root until the caller deletes it.
#pragma once

#include <map>
#include <string>

#include <json/value.h>

class Operation {
 public:
  // Starts a record for `kind` ("install", "start", ...) of package `id`.
  Operation(const std::string& kind, const std::string& id);
  ~Operation();
  Operation(const Operation&) = delete;
  Operation& operator=(const Operation&) = delete;

  const std::string& log_path() const { return log_path_; }
  const std::string& worker_message_path() const { return worker_path_; }
  // Appends a line to the operation log.
  void Log(const std::string& line) const;
  // The worker messages so far: each line scripts wrote to
  // $KIVO_WORKER_MSG, as an array of strings.
  Json::Value WorkerMessages() const;

  std::map<std::string, std::string> map_params;  // "curver", "oldver", "deppkg", ...
  Json::Value details{Json::objectValue};         // structured details of a refusal

 private:
  std::string log_path_;
  std::string worker_path_;
};
