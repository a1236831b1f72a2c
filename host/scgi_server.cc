#include "host/scgi_server.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdint>
#include <fcntl.h>
#include <initializer_list>
#include <iterator>
#include <list>
#include <map>
#include <string>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "host/scgi_child.h"
#include "host/scgi_request.h"

#include <poll.h>

namespace {

// Connections accepted and not yet given a child. At the cap the server stops
// accepting: further connections wait in the listening socket's queue. Each
// one holds at most a head and a small body here.
constexpr size_t kMaxPending = 256;

// An accepted connection whose request has no child yet.
struct Pending {
  int fd;
  int64_t accepted_ms;
  ScgiRequestReader request{kWholeBodyBytes};
  // Read as far as the parent reads it: it only waits for a child now.
  bool ready = false;
};
using PendingList = std::list<Pending>;

// What a live child holds.
struct Child {
  std::string address;
  bool streamed;  // it reads its body from the connection itself
};

// The server's descriptors, connections and children: one instance, on
// RunScgiServer's stack.
struct Server {
  int listen_fd;
  int signal_fd;
  ScgiServerOptions options;
  // The signals not handled by default here, which each child resets.
  sigset_t not_default;
  PendingList pending;  // in order of arrival
  std::map<pid_t, Child> children;
  std::map<std::string, int> per_address;  // live children of each address
  int streamed = 0;                        // live children that read their body
};

int Share(const ScgiServerOptions& o) {
  return o.max_per_address > 0 ? o.max_per_address : std::max(1, o.max_children / 2);
}

int StreamedCap(const ScgiServerOptions& o) { return std::max(1, o.max_children / 2); }

std::string Address(const Pending& p) { return p.request.Header("REMOTE_ADDR"); }

// Whether `p` is still waiting against its time: while its head or small
// body is on its way, and while an upload waits for a child. A whole
// request waits for a child as long as it takes.
bool HasDeadline(const Pending& p) { return !p.ready || !p.request.reads_body(); }

int64_t Deadline(const Server& server, const Pending& p) {
  return p.accepted_ms + static_cast<int64_t>(server.options.read_timeout_seconds) * 1000;
}

const char* Describe(ScgiReadResult result) {
  switch (result) {
    case ScgiReadResult::kMalformed:
      return "malformed request head";
    case ScgiReadResult::kTooLarge:
      return "request head too large";
    default:
      return "connection ended before the request head was whole";
  }
}

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
    auto child = server->children.find(pid);
    if (child != server->children.end()) {
      auto count = server->per_address.find(child->second.address);
      if (count != server->per_address.end() && --count->second <= 0)
        server->per_address.erase(count);
      if (child->second.streamed) --server->streamed;
      server->children.erase(child);
    }
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

void Drop(Server* server, PendingList::iterator p) {
  close(p->fd);
  server->pending.erase(p);
}

// Reads what arrived on `p`'s connection; drops it when it ended or broke.
void ReadPending(Server* server, PendingList::iterator p) {
  ScgiReadResult result = p->request.ReadFrom(p->fd);
  if (result == ScgiReadResult::kOk) p->ready = true;
  if (result == ScgiReadResult::kOk || result == ScgiReadResult::kMore) return;
  if (result != ScgiReadResult::kClosed)
    syslog(LOG_WARNING, "%s:%d %s", "scgi_server", __LINE__, Describe(result));
  Drop(server, p);
}

// Ends the wait of every request past its time. One whose small body came
// only in part goes to a child, which answers that the body is shorter than
// its length; the others are dropped.
void ExpireOverdue(Server* server) {
  int64_t now = MonotonicMs();
  for (auto p = server->pending.begin(); p != server->pending.end();) {
    auto next = std::next(p);
    if (HasDeadline(*p) && Deadline(*server, *p) <= now) {
      if (!p->ready && p->request.head_done() && p->request.reads_body()) {
        p->ready = true;
      } else {
        syslog(LOG_WARNING, "%s:%d %s", "scgi_server", __LINE__,
               p->ready ? "no request process free for an upload in time"
                        : "request head not whole in time");
        Drop(server, p);
      }
    }
    p = next;
  }
}

// Whether `p` may have a child now: one is free, its address is below its
// share, and an upload finds one of the children uploads may hold.
bool MayStart(const Server& server, const Pending& p) {
  if (!p.ready || static_cast<int>(server.children.size()) >= server.options.max_children)
    return false;
  auto count = server.per_address.find(Address(p));
  if (count != server.per_address.end() && count->second >= Share(server.options)) return false;
  return p.request.reads_body() || server.streamed < StreamedCap(server.options);
}

void StartChild(Server* server, PendingList::iterator p) {
  pid_t pid = fork();
  if (pid == 0) {
    close(server->listen_fd);
    close(server->signal_fd);
    for (const Pending& other : server->pending) {
      if (&other != &*p) close(other.fd);
    }
    RestoreDefaultSignals(server->not_default);
    ServeScgiConnection(p->fd, p->request,
                        RequestClock{p->accepted_ms, server->options.read_timeout_seconds});
  }
  if (pid < 0) {
    syslog(LOG_ERR, "%s:%d cannot fork a request process: %m", "scgi_server", __LINE__);
  } else {
    Child child{Address(*p), !p->request.reads_body()};
    ++server->per_address[child.address];
    if (child.streamed) ++server->streamed;
    server->children.emplace(pid, std::move(child));
  }
  Drop(server, p);
}

// Gives a child to each waiting request that may have one, oldest first.
void StartWhatMay(Server* server) {
  for (auto p = server->pending.begin(); p != server->pending.end();) {
    auto next = std::next(p);
    if (MayStart(*server, *p)) StartChild(server, p);
    p = next;
  }
}

// Accepts what is waiting, up to the cap, and reads what came with it.
void AcceptConnections(Server* server) {
  while (server->pending.size() < kMaxPending) {
    int conn = accept4(server->listen_fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (conn < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK)
        syslog(LOG_ERR, "%s:%d accept failed: %m", "scgi_server", __LINE__);
      return;
    }
    server->pending.push_back(Pending{conn, MonotonicMs()});
    ReadPending(server, std::prev(server->pending.end()));
  }
}

// Milliseconds until the nearest deadline of a waiting request; -1: none.
int PollTimeout(const Server& server) {
  int64_t nearest = INT64_MAX;
  for (const Pending& p : server.pending) {
    if (HasDeadline(p)) nearest = std::min(nearest, Deadline(server, p));
  }
  if (nearest == INT64_MAX) return -1;
  return static_cast<int>(std::clamp<int64_t>(nearest - MonotonicMs(), 0, INT_MAX));
}

// Waits for signals, new connections (below the cap) and bytes of the
// requests still being read; handles what came. False when a signal asks the
// server to stop, or it cannot wait.
bool ServeOnce(Server* server, bool* failed) {
  std::vector<pollfd> fds = {{server->signal_fd, POLLIN, 0}};
  bool accepting = server->pending.size() < kMaxPending;
  if (accepting) fds.push_back({server->listen_fd, POLLIN, 0});
  std::vector<PendingList::iterator> reading;
  for (auto p = server->pending.begin(); p != server->pending.end(); ++p) {
    if (p->ready) continue;
    fds.push_back({p->fd, POLLIN, 0});
    reading.push_back(p);
  }
  if (poll(fds.data(), fds.size(), PollTimeout(*server)) < 0) {
    if (errno == EINTR) return true;
    syslog(LOG_ERR, "%s:%d poll failed: %m", "scgi_server", __LINE__);
    return !(*failed = true);
  }
  if ((fds[0].revents & POLLIN) && HandleSignals(server)) return false;
  size_t first = accepting ? 2 : 1;
  for (size_t i = 0; i < reading.size(); ++i) {
    if (fds[first + i].revents) ReadPending(server, reading[i]);
  }
  ExpireOverdue(server);
  if (accepting && (fds[1].revents & POLLIN)) AcceptConnections(server);
  StartWhatMay(server);
  return true;
}

}  // namespace

int RunScgiServer(int listen_fd, const ScgiServerOptions& options) {
  sigset_t watched;
  sigemptyset(&watched);
  for (int sig : {SIGCHLD, SIGTERM, SIGINT, SIGHUP}) sigaddset(&watched, sig);
  // Blocked, these signals queue on a descriptor that poll watches with the
  // connections: no handler runs between accept and fork.
  sigprocmask(SIG_BLOCK, &watched, nullptr);
  Server server;
  server.listen_fd = listen_fd;
  server.signal_fd = signalfd(-1, &watched, SFD_CLOEXEC | SFD_NONBLOCK);
  server.options = options;
  server.not_default = SignalsNotDefault();
  if (server.signal_fd < 0 ||
      fcntl(listen_fd, F_SETFL, fcntl(listen_fd, F_GETFL) | O_NONBLOCK) != 0) {
    syslog(LOG_ERR, "%s:%d cannot set up the server: %m", "scgi_server", __LINE__);
    return 1;
  }
  bool failed = false;
  while (ServeOnce(&server, &failed)) {
  }
  for (const Pending& p : server.pending) close(p.fd);
  close(server.signal_fd);
  return failed ? 1 : 0;
}
