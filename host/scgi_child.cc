#include "host/scgi_child.h"

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <sys/mman.h>
#include <syslog.h>
#include <unistd.h>

#include "host/entry_main.h"

namespace {

// The request's variables, and nothing of the server's own environment, as
// the web server hands a CGI program.
void SetEnvironment(const ScgiHeaders& headers) {
  clearenv();
  for (const auto& header : headers) setenv(header.first.c_str(), header.second.c_str(), 1);
}

// `fd` moved above the standard descriptors (a copy that is closed on exec);
// -1 when it cannot be.
int AboveStdio(int fd) {
  if (fd > STDERR_FILENO) return fd;
  int moved = fcntl(fd, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
  close(fd);
  return moved;
}

// A memory file holding `body`, read from its start; -1 on failure.
int BodyFile(const std::string& body) {
  int fd = memfd_create("request-body", MFD_CLOEXEC);
  if (fd < 0) return -1;
  size_t done = 0;
  while (done < body.size()) {
    ssize_t n = write(fd, body.data() + done, body.size() - done);
    if (n <= 0) {
      close(fd);
      return -1;
    }
    done += static_cast<size_t>(n);
  }
  if (lseek(fd, 0, SEEK_SET) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// Makes `in` stdin and `conn` stdout, blocking as a CGI program's are, and
// leaves no other descriptor of them open, so that a process which closes or
// redirects both releases the connection. `in` may be `conn`.
bool BecomeStdio(int conn, int in) {
  bool same = in == conn;
  conn = AboveStdio(conn);
  in = same ? conn : AboveStdio(in);
  if (conn < 0 || in < 0) return false;
  int flags = fcntl(conn, F_GETFL);
  bool ok = flags >= 0 && fcntl(conn, F_SETFL, flags & ~O_NONBLOCK) == 0 &&
            dup2(in, STDIN_FILENO) == STDIN_FILENO && dup2(conn, STDOUT_FILENO) == STDOUT_FILENO;
  close(conn);
  if (!same) close(in);
  return ok;
}

}  // namespace

void ServeScgiConnection(int conn, const ScgiRequestReader& request, const RequestClock& clock) {
  int in = request.reads_body() ? BodyFile(request.body()) : conn;
  if (in < 0) {
    syslog(LOG_ERR, "%s:%d cannot hold the request body: %m", "scgi_child", __LINE__);
    _exit(1);
  }
  SetEnvironment(request.headers());
  if (!BecomeStdio(conn, in)) {
    syslog(LOG_ERR, "%s:%d cannot attach the connection: %m", "scgi_child", __LINE__);
    _exit(1);
  }
  int status = RunEntryRequest(clock);
  // The answer is flushed, then the process ends without exit's teardown:
  // the destructors and exit handlers of every preloaded library (the
  // request's objects are gone already) cost a child more than its request,
  // and nothing of theirs outlives the process.
  fflush(stdout);
  _exit(status);
}
