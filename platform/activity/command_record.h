// The activity log's entry for a command of the command-line tool: the
// changing commands (install, upgrade, install-server, uninstall, start,
// stop, rollback, drop-revision, auto-update) are recorded with origin "kivoctl" and the
// unix user who ran them (the one sudo names, when root runs it for them).
// The entry is begun before the command runs and finished with its exit
// status, so a command killed half way is left unfinished. Reads and the
// author's commands (build, inspect, ...) are not recorded.
#pragma once

#include <string>
#include <sys/types.h>
#include <vector>

#include "activity/activity_log.h"

namespace KivoActivity {

class CommandRecord {
 public:
  // Begins the entry of `command` with `args` (the words after it), if it
  // is recorded at all.
  CommandRecord(const std::string& command, const std::vector<std::string>& args);
  CommandRecord(const CommandRecord&) = delete;
  CommandRecord& operator=(const CommandRecord&) = delete;

  // Records the command's exit status (0 for success). Only the process
  // that began the entry finishes it.
  void Finish(int exit_status);

 private:
  ActivityLog log_;
  long long id_ = 0;
  pid_t pid_ = 0;
};

}  // namespace KivoActivity
