// kivo-webd's parent process: accepts SCGI connections, reads each request's
// head (and a small body) itself, and forks one child per request once it
// may have one. It holds no database connection, lock or file of the system
// root, so a child starts as clean as a fresh entry.cgi.
//
// Request processes are the scarce thing, so none waits for a client:
//  - The head, and a body of at most kWholeBodyBytes, must arrive within
//    `read_timeout_seconds` of the connection; the parent reads them from
//    all connections at once. A request whose head is not whole by then is
//    dropped; one whose small body is not whole by then goes to a child with
//    what came, which answers that the body was cut short.
//  - A larger body (an upload) is read by the child, by the request's
//    deadline (host/request_deadline.h). Such requests hold at most half of
//    the children (at least one), so that the others stay free for requests
//    that are whole; one that finds no child within `read_timeout_seconds`
//    is dropped.
//  - One client address (REMOTE_ADDR) holds at most `max_per_address`
//    children; its further requests wait until one of its children ends.
#pragma once

#include <cstddef>

#include "host/request_deadline.h"

// The largest body the parent reads before it forks: sign-ins, calls and
// small uploads never take a child before they are whole.
constexpr size_t kWholeBodyBytes = 64 << 10;

struct ScgiServerOptions {
  // Children alive at once. Requests beyond wait in the server.
  int max_children = 16;
  // Children one client address may hold at once; 0: half of max_children,
  // at least one.
  int max_per_address = 0;
  // The time a request's head and small body may take to arrive, and the
  // allowance of a larger body's deadline.
  int read_timeout_seconds = kDefaultRequestSeconds;
};

// Serves `listen_fd` (a listening stream socket) until SIGTERM, SIGINT or
// SIGHUP: accept, read heads, fork (the child runs ServeScgiConnection),
// close the connection in the parent, reap ended children. A child that
// crashes is logged and reaped; the server goes on. Returns 0 after a stop
// signal, 1 when the server cannot wait for events.
int RunScgiServer(int listen_fd, const ScgiServerOptions& options);
