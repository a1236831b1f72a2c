// kivo-webd's parent process: accepts SCGI connections and forks one child
// per connection. It never reads request data and holds no database
// connection, lock or file of the system root, so a child starts as clean as
// a fresh entry.cgi.
#pragma once

struct ScgiServerOptions {
  // Children alive at once. At the cap the server stops accepting; further
  // connections wait in the listening socket's queue until a child ends.
  int max_children = 16;
  // A child's receive time limit on its connection (seconds without a byte).
  int read_timeout_seconds = 30;
};

// Serves `listen_fd` (a listening stream socket) until SIGTERM, SIGINT or
// SIGHUP: accept, fork (the child runs ServeScgiConnection), close the
// connection in the parent, reap ended children. A child that crashes is
// logged and reaped; the server goes on. Returns 0 after a stop signal, 1
// when the server cannot wait for events.
int RunScgiServer(int listen_fd, const ScgiServerOptions& options);
