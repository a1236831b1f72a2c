// A small HTTP server on 127.0.0.1 for tests of the package server library,
// serving what each test describes per path and misbehaving on request:
// slow bodies, connections dropped mid-body, more bytes than a client
// expects, endless bodies, error statuses. It honours "Range: bytes=N-" and
// ETag / If-None-Match, and counts the requests per path. Each connection
// is served by a thread of its own; the destructor stops them all.
#pragma once

#include <atomic>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

struct HttpRoute {
  int status = 200;
  std::string body;
  std::string etag;        // sent when set; an equal If-None-Match gets 304
  bool ranges = true;      // answer "Range: bytes=N-" with 206
  std::string location;    // sent as Location (for redirects)
  int delay_ms = 0;        // before the answer
  size_t slow_chunk = 0;   // when set: the body in chunks of this size ...
  int chunk_delay_ms = 0;  // ... with this pause between them
  size_t drop_after = 0;   // when set: close after this many body bytes ...
  int drop_times = 0;      // ... for this many requests
  bool endless = false;    // a body without length that never ends
  size_t hold_after = 0;   // when set: after this many body bytes, wait for Release()
};

class HttpTestServer {
 public:
  HttpTestServer();
  ~HttpTestServer();
  HttpTestServer(const HttpTestServer&) = delete;
  HttpTestServer& operator=(const HttpTestServer&) = delete;

  int port() const { return port_; }
  // "http://127.0.0.1:<port>" + path
  std::string Url(const std::string& path) const;
  void Set(const std::string& path, const HttpRoute& route);
  // Requests for `path` so far, and the header block of the last one.
  int Requests(const std::string& path);
  std::string LastHeaders(const std::string& path);
  // The query string of the last request for `path`.
  std::string LastQuery(const std::string& path);
  // Lets every body held at its route's hold_after go on.
  void Release() { released_ = true; }

 private:
  void Accept();
  void Serve(int fd);

  int listen_fd_ = -1;
  int port_ = 0;
  std::atomic<bool> stopping_{false};
  std::atomic<bool> released_{false};
  std::mutex mu_;
  std::map<std::string, HttpRoute> routes_;
  std::map<std::string, int> counts_;
  std::map<std::string, std::string> headers_;
  std::map<std::string, std::string> queries_;
  std::vector<std::thread> workers_;
  std::thread acceptor_;
};
