#include "pkgtool/script_runner.h"

#include <cstdlib>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "pkgtool/pms.h"

#include <time.h>

namespace {

[[noreturn]] void ExecScript(const std::string& script, const std::string& arg,
                             const std::vector<std::string>& env, const std::string& log_path) {
  setsid();
  int in = open("/dev/null", O_RDONLY);
  int out =
      open(log_path.empty() ? "/dev/null" : log_path.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
  if (in >= 0) dup2(in, STDIN_FILENO);
  if (out >= 0) {
    dup2(out, STDOUT_FILENO);
    dup2(out, STDERR_FILENO);
  }
  for (int fd = 3; fd < 1024; ++fd) close(fd);
  signal(SIGPIPE, SIG_DFL);
  std::vector<char*> envp;
  for (const std::string& e : env) envp.push_back(const_cast<char*>(e.c_str()));
  envp.push_back(nullptr);
  std::vector<char*> argv{const_cast<char*>(script.c_str())};
  if (!arg.empty()) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  execve(script.c_str(), argv.data(), envp.data());
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

}  // namespace

int PMSRunScript(const std::string& script, const std::string& arg,
                 const std::map<std::string, std::string>& env, int timeout_seconds,
                 const std::string& log_path) {
  struct stat st;
  if (stat(script.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return SCRIPT_MISSING;
  std::vector<std::string> vars;
  for (const auto& e : env) vars.push_back(e.first + "=" + e.second);
  fflush(nullptr);
  pid_t pid = fork();
  if (pid < 0) return SCRIPT_NOT_RUN;
  if (pid == 0) ExecScript(script, arg, vars, log_path);
  int status = 0;
  if (!WaitUntil(pid, Now() + timeout_seconds, &status)) {
    // The script and whatever it started form one process group.
    kill(-pid, SIGTERM);
    if (!WaitUntil(pid, Now() + 2, &status)) {
      kill(-pid, SIGKILL);
      waitpid(pid, &status, 0);
    }
    return SCRIPT_TIMED_OUT;
  }
  if (WIFEXITED(status)) return WEXITSTATUS(status) == 126 ? SCRIPT_NOT_RUN : WEXITSTATUS(status);
  return 128 + WTERMSIG(status);
}

int PMSScriptTimeout() { return PMSToolSetting("script_timeout", 120, 1); }
