// Runs a package's scripts: in a session of their own (so a time-out kills
// every process a script started), with a defined environment, stdin from
// /dev/null and stdout/stderr appended to the operation log.
#pragma once

#include <cstdint>
#include <map>
#include <string>

// Result of a script run: its exit status, or one of these.
enum ScriptStatus {
  SCRIPT_MISSING = -1,    // the package has no such script (not a failure)
  SCRIPT_TIMED_OUT = -2,  // killed after the time limit
  SCRIPT_NOT_RUN = -3,    // could not be started
};

// Runs `script` with the single argument `arg` (may be empty) and exactly
// the environment `env`, waiting at most `timeout_seconds`.
[[nodiscard]] int PMSRunScript(const std::string& script, const std::string& arg,
                               const std::map<std::string, std::string>& env, int timeout_seconds,
                               const std::string& log_path);

// How a script whose output was captured ended.
struct ScriptOutput {
  int status = SCRIPT_NOT_RUN;  // as PMSRunScript answers
  std::string tail;             // the last bytes it wrote (stdout and stderr together)
  uint64_t total = 0;           // how many bytes it wrote in all
};

// Runs `script` as PMSRunScript does, but reads its output through a pipe
// and keeps only the last `keep` bytes, however much it writes. It ends when
// the script has ended (processes it left behind are not waited for) or,
// after `timeout_seconds`, with SCRIPT_TIMED_OUT, the script killed with its
// whole process group.
[[nodiscard]] ScriptOutput PMSRunScriptCaptured(const std::string& script, const std::string& arg,
                                                const std::map<std::string, std::string>& env,
                                                int timeout_seconds, size_t keep);

// The script time limit: "script_timeout" of /etc/kivo/pkgtool.conf (seconds),
// 120 by default.
int PMSScriptTimeout();
