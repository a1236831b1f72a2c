#include "klibc/process.h"

#include <cstring>
#include <errno.h>
#include <fcntl.h>
#include <map>
#include <mutex>
#include <signal.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "klibc/last_error.h"

namespace {

std::vector<char*> BuildArgv(const char* path, const char* a1, const char* a2, const char* a3,
                             const char* a4) {
  std::vector<char*> argv{const_cast<char*>(path)};
  for (const char* a : {a1, a2, a3, a4}) {
    if (!a) break;
    argv.push_back(const_cast<char*>(a));
  }
  argv.push_back(nullptr);
  return argv;
}

int WaitStatus(pid_t pid) {
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

// In the child: `out_fd` becomes stdout (or stdin when `to_stdin`), then exec.
[[noreturn]] void ExecChild(const std::vector<char*>& argv, int fd, bool to_stdin) {
  if (to_stdin) {
    dup2(fd, STDIN_FILENO);
  } else {
    dup2(fd >= 0 ? fd : STDERR_FILENO, STDOUT_FILENO);
  }
  signal(SIGPIPE, SIG_DFL);
  execv(argv[0], argv.data());
  _exit(127);
}

// Streams opened by KLIBCPopen and the programs behind them.
std::mutex g_popen_mutex;
std::map<FILE*, pid_t> g_popen_pids;

}  // namespace

int KLIBCExec(const char* path, const char* arg1, const char* arg2, const char* arg3,
              const char* arg4) {
  if (!path) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::vector<char*> argv = BuildArgv(path, arg1, arg2, arg3, arg4);
  fflush(nullptr);
  pid_t pid = fork();
  if (pid < 0) {
    KLIBCErrSet(KLIBC_ERR_EXEC);
    return -1;
  }
  if (pid == 0) ExecChild(argv, -1, false);
  int status = WaitStatus(pid);
  if (status < 0 || status == 127) KLIBCErrSet(KLIBC_ERR_EXEC);
  return status;
}

FILE* KLIBCPopen(const char* path, const char* mode, const char* arg1, const char* arg2,
                 const char* arg3, const char* arg4) {
  if (!path || !mode || (strcmp(mode, "r") != 0 && strcmp(mode, "w") != 0)) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return nullptr;
  }
  bool reading = mode[0] == 'r';
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) {
    KLIBCErrSet(KLIBC_ERR_EXEC);
    return nullptr;
  }
  std::vector<char*> argv = BuildArgv(path, arg1, arg2, arg3, arg4);
  fflush(nullptr);
  pid_t pid = fork();
  if (pid < 0) {
    close(fds[0]);
    close(fds[1]);
    KLIBCErrSet(KLIBC_ERR_EXEC);
    return nullptr;
  }
  if (pid == 0) ExecChild(argv, reading ? fds[1] : fds[0], !reading);
  close(reading ? fds[1] : fds[0]);
  FILE* stream = fdopen(reading ? fds[0] : fds[1], mode);
  if (!stream) {
    close(reading ? fds[0] : fds[1]);
    WaitStatus(pid);
    KLIBCErrSet(KLIBC_ERR_EXEC);
    return nullptr;
  }
  std::lock_guard<std::mutex> lock(g_popen_mutex);
  g_popen_pids[stream] = pid;
  return stream;
}

int KLIBCPclose(FILE* stream) {
  pid_t pid = -1;
  {
    std::lock_guard<std::mutex> lock(g_popen_mutex);
    auto it = g_popen_pids.find(stream);
    if (it == g_popen_pids.end()) {
      KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
      return -1;
    }
    pid = it->second;
    g_popen_pids.erase(it);
  }
  fclose(stream);
  return WaitStatus(pid);
}

pid_t KLIBCProcFork() {
  fflush(nullptr);
  return fork();
}

int KLIBCProcAlive(pid_t pid) {
  if (pid <= 0) return 0;
  if (kill(pid, 0) != 0 && errno != EPERM) return 0;
  // A zombie still answers kill(): it has ended, only nobody has reaped it.
  char path[64];
  snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
  FILE* f = fopen(path, "re");
  if (!f) return 0;
  char buf[512];
  size_t n = fread(buf, 1, sizeof(buf) - 1, f);
  fclose(f);
  buf[n] = '\0';
  const char* close_paren = strrchr(buf, ')');
  return close_paren && close_paren[1] == ' ' && close_paren[2] == 'Z' ? 0 : 1;
}
