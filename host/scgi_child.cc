#include "host/scgi_child.h"

#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <syslog.h>
#include <unistd.h>

#include "host/entry_main.h"
#include "host/scgi_request.h"

namespace {

const char* Describe(ScgiHeadResult result) {
  switch (result) {
    case ScgiHeadResult::kOk:
      return "ok";
    case ScgiHeadResult::kClosed:
      return "connection ended or timed out before the request head was whole";
    case ScgiHeadResult::kMalformed:
      return "malformed request head";
    case ScgiHeadResult::kTooLarge:
      return "request head too large";
  }
  return "unknown";
}

// The request's variables, and nothing of the server's own environment, as
// the web server hands a CGI program.
void SetEnvironment(const ScgiHeaders& headers) {
  clearenv();
  for (const auto& header : headers) setenv(header.first.c_str(), header.second.c_str(), 1);
}

// Makes `conn` stdin and stdout and leaves no other descriptor of it open, so
// that a process which closes or redirects both releases the connection.
bool BecomeStdio(int conn) {
  if (conn <= STDOUT_FILENO) {
    int moved = fcntl(conn, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
    if (moved < 0) return false;
    close(conn);
    conn = moved;
  }
  bool ok = dup2(conn, STDIN_FILENO) == STDIN_FILENO && dup2(conn, STDOUT_FILENO) == STDOUT_FILENO;
  close(conn);
  return ok;
}

}  // namespace

void ServeScgiConnection(int conn, int read_timeout_seconds) {
  timeval limit{};
  limit.tv_sec = read_timeout_seconds;
  if (setsockopt(conn, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit)) != 0) {
    syslog(LOG_ERR, "%s:%d cannot set the receive time limit: %m", "scgi_child", __LINE__);
    _exit(1);
  }
  ScgiHeaders headers;
  ScgiHeadResult head = ReadScgiHead(conn, &headers);
  if (head != ScgiHeadResult::kOk) {
    syslog(LOG_ERR, "%s:%d %s", "scgi_child", __LINE__, Describe(head));
    _exit(1);
  }
  SetEnvironment(headers);
  if (!BecomeStdio(conn)) {
    syslog(LOG_ERR, "%s:%d cannot attach the connection: %m", "scgi_child", __LINE__);
    _exit(1);
  }
  int status = RunEntryRequest();
  // The answer is flushed, then the process ends without exit's teardown:
  // the destructors and exit handlers of every preloaded library (the
  // request's objects are gone already) cost a child more than its request,
  // and nothing of theirs outlives the process.
  fflush(stdout);
  _exit(status);
}
