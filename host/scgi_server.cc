#include "host/scgi_server.h"

#include <cerrno>
#include <csignal>
#include <fcntl.h>
#include <initializer_list>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include "host/scgi_child.h"

#include <poll.h>

namespace {

// The server's descriptors and counters: one instance, on RunScgiServer's stack.
struct Server {
  int listen_fd;
  int signal_fd;
  ScgiServerOptions options;
  // The signals not handled by default here, which each child resets.
  sigset_t not_default;
  int live = 0;
};

// The signals whose handling is not the default in this process. Asked once,
// so that a child resets only these instead of asking the kernel about every
// signal on each request.
sigset_t SignalsNotDefault() {
  sigset_t found;
  sigemptyset(&found);
  for (int sig = 1; sig < NSIG; ++sig) {
    struct sigaction current;
    if (sigaction(sig, nullptr, &current) == 0 && current.sa_handler != SIG_DFL)
      sigaddset(&found, sig);
  }
  return found;
}

// A child starts like a program the web server runs: default handling for
// every signal, none blocked.
void RestoreDefaultSignals(const sigset_t& not_default) {
  for (int sig = 1; sig < NSIG; ++sig) {
    if (sigismember(&not_default, sig) == 1) signal(sig, SIG_DFL);
  }
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
}

void ReapChildren(Server* server) {
  int status = 0;
  for (pid_t pid; (pid = waitpid(-1, &status, WNOHANG)) > 0;) {
    --server->live;
    if (WIFSIGNALED(status)) {
      syslog(LOG_WARNING, "%s:%d request process %d ended by signal %d", "scgi_server", __LINE__,
             static_cast<int>(pid), WTERMSIG(status));
    }
  }
}

// Reads the pending signals; true when one asks the server to stop.
bool HandleSignals(Server* server) {
  bool stop = false;
  signalfd_siginfo info;
  while (read(server->signal_fd, &info, sizeof(info)) == static_cast<ssize_t>(sizeof(info))) {
    if (info.ssi_signo != SIGCHLD) stop = true;
  }
  ReapChildren(server);
  return stop;
}

void StartChild(Server* server, int conn) {
  pid_t pid = fork();
  if (pid == 0) {
    close(server->listen_fd);
    close(server->signal_fd);
    RestoreDefaultSignals(server->not_default);
    ServeScgiConnection(conn, server->options.read_timeout_seconds);
  }
  close(conn);
  if (pid < 0) {
    syslog(LOG_ERR, "%s:%d cannot fork a request process: %m", "scgi_server", __LINE__);
    return;
  }
  ++server->live;
}

// Accepts what is waiting, up to the cap.
void AcceptConnections(Server* server) {
  while (server->live < server->options.max_children) {
    int conn = accept4(server->listen_fd, nullptr, nullptr, SOCK_CLOEXEC);
    if (conn < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK)
        syslog(LOG_ERR, "%s:%d accept failed: %m", "scgi_server", __LINE__);
      return;
    }
    StartChild(server, conn);
  }
}

}  // namespace

int RunScgiServer(int listen_fd, const ScgiServerOptions& options) {
  sigset_t watched;
  sigemptyset(&watched);
  for (int sig : {SIGCHLD, SIGTERM, SIGINT, SIGHUP}) sigaddset(&watched, sig);
  // Blocked, these signals queue on a descriptor that poll watches with the
  // listening socket: no handler runs between accept and fork.
  sigprocmask(SIG_BLOCK, &watched, nullptr);
  Server server{listen_fd, signalfd(-1, &watched, SFD_CLOEXEC | SFD_NONBLOCK), options,
                SignalsNotDefault()};
  if (server.signal_fd < 0 ||
      fcntl(listen_fd, F_SETFL, fcntl(listen_fd, F_GETFL) | O_NONBLOCK) != 0) {
    syslog(LOG_ERR, "%s:%d cannot set up the server: %m", "scgi_server", __LINE__);
    return 1;
  }
  for (;;) {
    pollfd fds[2] = {{server.signal_fd, POLLIN, 0}, {listen_fd, POLLIN, 0}};
    // At the cap only signals are watched: connections wait in the queue.
    nfds_t count = server.live < options.max_children ? 2 : 1;
    if (poll(fds, count, -1) < 0) {
      if (errno == EINTR) continue;
      syslog(LOG_ERR, "%s:%d poll failed: %m", "scgi_server", __LINE__);
      return 1;
    }
    if ((fds[0].revents & POLLIN) && HandleSignals(&server)) break;
    if (count == 2 && (fds[1].revents & POLLIN)) AcceptConnections(&server);
  }
  close(server.signal_fd);
  return 0;
}
