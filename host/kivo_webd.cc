// kivo-webd: the web API behind the web server's SCGI module, one process
// per request without a program start per request. It loads the modules and
// the request code's libraries once, then forks a child for each connection
// that runs exactly entry.cgi's request code (host/entry_main.h).
//
//   kivo-webd [--socket PATH] [--max-children N] [--max-per-address N]
//             [--read-timeout SECONDS]
//
// --max-children caps the request processes; --max-per-address caps those of
// one client address (default half of them); --read-timeout is the time a
// request's head and small body may take to arrive, and the allowance of a
// larger body's deadline (host/scgi_server.h).
//
// Without --socket it serves the listening socket on its stdin, as the web
// server hands it to a backend it spawns (and respawns). --socket PATH makes
// and serves a unix socket of its own, for running it by hand.

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <sys/auxv.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include "host/module_table.h"
#include "host/scgi_preload.h"
#include "host/scgi_server.h"

namespace {

struct Options {
  std::string socket_path;  // empty: the listening socket is stdin
  ScgiServerOptions server;
};

int Usage(const char* why) {
  fprintf(stderr,
          "kivo-webd: %s\n"
          "usage: kivo-webd [--socket PATH] [--max-children N] [--max-per-address N]\n"
          "                 [--read-timeout SECONDS]\n",
          why);
  return 2;
}

// A positive count no larger than `max`; 0 when `text` is not one.
int PositiveNumber(const char* text, int max) {
  char* end = nullptr;
  errno = 0;
  long value = strtol(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || value < 1 || value > max) return 0;
  return static_cast<int>(value);
}

bool ParseOptions(int argc, char** argv, Options* options, const char** why) {
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (i + 1 >= argc) return (*why = "an option lacks its value"), false;
    const char* value = argv[++i];
    if (arg == "--socket") {
      options->socket_path = value;
    } else if (arg == "--max-children") {
      options->server.max_children = PositiveNumber(value, 4096);
      if (!options->server.max_children) return (*why = "--max-children: 1 to 4096"), false;
    } else if (arg == "--max-per-address") {
      options->server.max_per_address = PositiveNumber(value, 4096);
      if (!options->server.max_per_address) return (*why = "--max-per-address: 1 to 4096"), false;
    } else if (arg == "--read-timeout") {
      options->server.read_timeout_seconds = PositiveNumber(value, 86400);
      if (!options->server.read_timeout_seconds)
        return (*why = "--read-timeout: 1 to 86400 seconds"), false;
    } else {
      return (*why = "unknown option"), false;
    }
  }
  return true;
}

bool IsListeningSocket(int fd) {
  int listening = 0;
  socklen_t size = sizeof(listening);
  return getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &size) == 0 && listening;
}

// A socket file left by a server that is gone may be replaced; a live one or
// any other file may not.
bool ClearStaleSocket(const sockaddr_un& addr) {
  struct stat st;
  if (lstat(addr.sun_path, &st) != 0) return errno == ENOENT;
  if (!S_ISSOCK(st.st_mode)) return false;
  int probe = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  bool live = connect(probe, reinterpret_cast<const sockaddr*>(&addr), sizeof(addr)) == 0;
  close(probe);
  return !live && unlink(addr.sun_path) == 0;
}

// A listening unix socket at `path` (mode 0660); -1 with a message on stderr.
int ListenAt(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(addr.sun_path)) {
    fprintf(stderr, "kivo-webd: socket path empty or too long: %s\n", path.c_str());
    return -1;
  }
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  if (!ClearStaleSocket(addr)) {
    fprintf(stderr, "kivo-webd: %s exists and is not a stale socket\n", path.c_str());
    return -1;
  }
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  mode_t old_mask = umask(0117);
  bool ok = fd >= 0 && bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0 &&
            listen(fd, 1024) == 0;
  umask(old_mask);
  if (!ok) {
    fprintf(stderr, "kivo-webd: cannot listen on %s: %s\n", path.c_str(), strerror(errno));
    if (fd >= 0) close(fd);
    return -1;
  }
  return fd;
}

// Starts this program again with every library function bound at load time.
// Bound lazily, each child would bind every function it calls on first use:
// the loader's lookups took about a sixth of a request's time, and each
// write to a binding table copied a page the child shares with this parent.
// The variable is dropped once the loader has read it, so that programs the
// request code runs start as usual.
void BindEverythingNow(char** argv) {
  const char* bind_now = getenv("LD_BIND_NOW");
  char self[4096];
  ssize_t size = readlink("/proc/self/exe", self, sizeof(self));
  // A set-id start may lose the variable on the way: it would start again
  // for ever, so it goes on lazily bound.
  if ((!bind_now || !*bind_now) && size > 0 && size < static_cast<ssize_t>(sizeof(self)) &&
      !getauxval(AT_SECURE)) {
    // Through its own file name, so that the process keeps its name.
    self[size] = '\0';
    setenv("LD_BIND_NOW", "1", 1);
    execv(self, argv);
    // Not fatal: the server runs, only each request costs more.
    syslog(LOG_WARNING, "%s:%d cannot start again with bound libraries: %s", "kivo_webd", __LINE__,
           strerror(errno));
  }
  unsetenv("LD_BIND_NOW");
}

}  // namespace

int main(int argc, char** argv) {
  BindEverythingNow(argv);
  Options options;
  const char* why = nullptr;
  if (!ParseOptions(argc, argv, &options, &why)) return Usage(why);
  openlog("kivo-webd", LOG_PID | LOG_PERROR, LOG_USER);
  int listen_fd = STDIN_FILENO;
  if (!options.socket_path.empty()) {
    listen_fd = ListenAt(options.socket_path);
    if (listen_fd < 0) return 1;
  } else if (!IsListeningSocket(STDIN_FILENO)) {
    return Usage("stdin is not a listening socket: give --socket PATH");
  }
  for (const std::string& failure : PreloadRequestLibraries(DefaultModuleDir()))
    syslog(LOG_WARNING, "%s:%d not preloaded: %s", "kivo_webd", __LINE__, failure.c_str());
  int status = RunScgiServer(listen_fd, options.server);
  if (!options.socket_path.empty()) unlink(options.socket_path.c_str());
  return status;
}
