#include "pkgtool/script_runner.h"

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_confinement.h"
#include "pkgtool/pms.h"

#include <poll.h>
#include <time.h>

namespace {

// The package's own user and confinement (package_confinement.h), entered
// here and nowhere else. Runs in the child between fork and exec: nothing
// here allocates, and a step that fails fails the whole start, since the
// script must never run with less confinement than its record claims.
bool EnterConfinement(const PackageConfinement& confinement) {
  if (confinement.drop_user) {
    if (setgroups(0, nullptr) != 0 ||
        setresgid(confinement.gid, confinement.gid, confinement.gid) != 0 ||
        setresuid(confinement.uid, confinement.uid, confinement.uid) != 0 ||
        getuid() != confinement.uid || getgid() != confinement.gid) {
      return false;
    }
  }
  if (confinement.no_new_privs && prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return false;
  return confinement.landlock_ruleset < 0 ||
         syscall(SYS_landlock_restrict_self, confinement.landlock_ruleset, 0) == 0;
}

// Runs in the forked child: `out` becomes its stdout and stderr. `argv` and
// `envp` were made before the fork.
[[noreturn]] void ExecScript(const char* script, char* const* argv, char* const* envp, int out,
                             const PackageCgroupJoin& group,
                             const PackageConfinement& confinement) {
  setsid();
  // The package's control group first: moving into it needs the rights
  // that confinement may drop further down.
  if (!group.JoinInChild()) _exit(126);
  int in = open("/dev/null", O_RDONLY);
  if (in >= 0) dup2(in, STDIN_FILENO);
  if (out >= 0) {
    dup2(out, STDOUT_FILENO);
    dup2(out, STDERR_FILENO);
  }
  if (!EnterConfinement(confinement)) _exit(126);
  for (int fd = 3; fd < 1024; ++fd) close(fd);
  signal(SIGPIPE, SIG_DFL);
  // A script (and the service it starts) gets no signal blocked, whatever
  // its caller blocks: the watchdog waits for its own signals blocked.
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  execve(script, argv, envp);
  _exit(126);
}

double Now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

// Waits for `pid` until `deadline`; true with *status when it ended.
bool WaitUntil(pid_t pid, double deadline, int* status) {
  int delay_us = 1000;
  while (true) {
    pid_t r = waitpid(pid, status, WNOHANG);
    if (r == pid) return true;
    if (r < 0) return false;
    if (Now() >= deadline) return false;
    usleep(delay_us);
    if (delay_us < 50000) delay_us *= 2;
  }
}

bool IsScript(const std::string& script) {
  struct stat st;
  return stat(script.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

// Forks and starts `script` with `out` as its output; the child's pid, or
// -1.
pid_t StartScript(const std::string& script, const std::string& arg,
                  const std::map<std::string, std::string>& env, int out) {
  const PackageCgroupJoin group = PackageCgroupPrepareForScript(script, out);
  const PackageConfinement confinement =
      PackageConfinementPrepareForScript(script, arg, env, group.missing(), out);
  std::map<std::string, std::string> all = env;
  if (!confinement.tmpdir.empty()) all["TMPDIR"] = confinement.tmpdir;
  std::vector<std::string> vars;
  for (const auto& e : all) vars.push_back(e.first + "=" + e.second);
  std::vector<char*> envp;
  for (const std::string& e : vars) envp.push_back(const_cast<char*>(e.c_str()));
  envp.push_back(nullptr);
  std::vector<char*> argv{const_cast<char*>(script.c_str())};
  if (!arg.empty()) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  fflush(nullptr);
  pid_t pid = fork();
  if (pid == 0) ExecScript(script.c_str(), argv.data(), envp.data(), out, group, confinement);
  return pid;
}

// A wait status as PMSRunScript answers it.
int ScriptResult(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status) == 126 ? SCRIPT_NOT_RUN : WEXITSTATUS(status);
  return 128 + WTERMSIG(status);
}

// Waits for the script `pid` until `deadline`, then kills it with its whole
// process group (the script and whatever it started).
int FinishScript(pid_t pid, double deadline) {
  int status = 0;
  if (WaitUntil(pid, deadline, &status)) return ScriptResult(status);
  kill(-pid, SIGTERM);
  if (!WaitUntil(pid, Now() + 2, &status)) {
    kill(-pid, SIGKILL);
    waitpid(pid, &status, 0);
  }
  return SCRIPT_TIMED_OUT;
}

// Reads the script's output `fd` into `out` until every writer has closed
// it, the script `pid` has ended with nothing more waiting (what it left
// running may hold the pipe open for ever), or `deadline`. Keeps only the
// last `keep` bytes. True when the script ended meanwhile (*status).
bool ReadOutput(int fd, pid_t pid, double deadline, size_t keep, ScriptOutput* out, int* status) {
  bool ended = false;
  char buf[65536];
  while (Now() < deadline) {
    if (!ended && waitpid(pid, status, WNOHANG) == pid) ended = true;
    struct pollfd ready = {fd, POLLIN, 0};
    int n = poll(&ready, 1, ended ? 0 : 100);
    if (n < 0 && errno != EINTR) break;
    if (n <= 0) {
      if (ended) break;
      continue;
    }
    ssize_t got = read(fd, buf, sizeof(buf));
    if (got == 0 || (got < 0 && errno != EINTR && errno != EAGAIN)) break;
    if (got < 0) continue;
    out->total += static_cast<uint64_t>(got);
    out->tail.append(buf, static_cast<size_t>(got));
    if (out->tail.size() > keep) out->tail.erase(0, out->tail.size() - keep);
  }
  return ended;
}

}  // namespace

int PMSRunScript(const std::string& script, const std::string& arg,
                 const std::map<std::string, std::string>& env, int timeout_seconds,
                 const std::string& log_path) {
  if (!IsScript(script)) return SCRIPT_MISSING;
  int out = open(log_path.empty() ? "/dev/null" : log_path.c_str(),
                 O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  pid_t pid = StartScript(script, arg, env, out);
  if (out >= 0) close(out);
  if (pid < 0) return SCRIPT_NOT_RUN;
  return FinishScript(pid, Now() + timeout_seconds);
}

ScriptOutput PMSRunScriptCaptured(const std::string& script, const std::string& arg,
                                  const std::map<std::string, std::string>& env,
                                  int timeout_seconds, size_t keep) {
  ScriptOutput out;
  if (!IsScript(script)) {
    out.status = SCRIPT_MISSING;
    return out;
  }
  int pipe_fds[2];
  if (pipe2(pipe_fds, O_CLOEXEC) != 0) return out;
  // Only our end waits for nothing: the script writes as to any pipe.
  fcntl(pipe_fds[0], F_SETFL, O_NONBLOCK);
  pid_t pid = StartScript(script, arg, env, pipe_fds[1]);
  close(pipe_fds[1]);
  if (pid < 0) {
    close(pipe_fds[0]);
    return out;
  }
  const double deadline = Now() + timeout_seconds;
  int status = 0;
  const bool ended = ReadOutput(pipe_fds[0], pid, deadline, keep, &out, &status);
  close(pipe_fds[0]);
  out.status = ended ? ScriptResult(status) : FinishScript(pid, deadline);
  return out;
}

int PMSScriptTimeout() { return PMSToolSetting("script_timeout", 120, 1); }
