// lighttpd serving a system root's web API on a loopback port chosen at run
// time, for end-to-end tests and benchmarks. Stopped when destroyed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <sys/types.h>

#include "tools/kivoctl/web_config.h"

struct WebServerOptions {
  WebMode mode = WebMode::kCgi;
  std::string entry_cgi;   // cgi: replaces the build's entry.cgi (benchmarks serve a baseline)
  std::string module_dir;  // empty: the build's modules folder
  int max_children = 16;   // scgi: kivo-webd's cap
  int read_timeout_seconds = kDefaultRequestSeconds;
  uint64_t max_upload_bytes = kDefaultMaxUploadBytes;  // lighttpd's limit on uploads
};

// "cgi" / "scgi", for test names and benchmark rows.
const char* WebModeName(WebMode mode);

class WebServer {
 public:
  // Starts lighttpd for `root` with the configuration `kivoctl web-config`
  // writes, and waits until it accepts connections. Check running().
  // `entry_cgi` replaces the build's entry.cgi (benchmarks serve a baseline).
  explicit WebServer(const std::string& root, const std::string& entry_cgi = "");
  WebServer(const std::string& root, const WebServerOptions& options);
  ~WebServer();
  WebServer(const WebServer&) = delete;
  WebServer& operator=(const WebServer&) = delete;

  bool running() const { return pid_ > 0; }
  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  // The kivo-webd process lighttpd runs for this server (scgi mode); -1 when
  // there is none right now.
  pid_t WebdPid() const;
  // "http://127.0.0.1:<port>/webapi/entry.cgi"
  std::string EntryURL() const;

 private:
  pid_t pid_ = -1;
  int port_ = 0;
};

// A port on 127.0.0.1 that nothing listens on right now.
int FreeLoopbackPort();

// One HTTP/1.0 GET of `target` on 127.0.0.1:`port` with extra header lines
// (each ending in "\r\n"), read to the end. The bytes received; 0 when the
// connection failed.
size_t LoopbackGet(int port, const std::string& target, const std::string& headers);

// Sends `request` (raw HTTP) to 127.0.0.1:`port` and returns the whole
// response as read to the end; empty when the connection failed.
std::string LoopbackExchange(int port, const std::string& request);
