// The web server configuration that serves the web API of a system root:
// lighttpd on one address and port, the web API at /webapi/entry.cgi, run
// either as a CGI program per request or by kivo-webd behind lighttpd's SCGI
// module (a forked child per request, no program start).
#pragma once

#include <cstdint>
#include <string>

#include "host/host_config.h"
#include "host/request_deadline.h"

enum class WebMode { kCgi, kScgi };

struct WebConfigOptions {
  std::string root;  // the system root (KIVO_ROOT of every request)
  WebMode mode = WebMode::kCgi;
  std::string entry_cgi;  // cgi: absolute path of entry.cgi
  std::string webd;       // scgi: absolute path of kivo-webd
  int max_children = 16;  // scgi: requests served at once; more wait
  // lighttpd: the longest pause in a request it reads; scgi: the time a
  // request's head and small body may take (host/scgi_server.h).
  int read_timeout_seconds = kDefaultRequestSeconds;
  // The largest upload lighttpd lets through: the root's max_upload_bytes.
  uint64_t max_upload_bytes = kDefaultMaxUploadBytes;
  std::string module_dir;  // the modules folder; empty: the one beside the program
  std::string address = "127.0.0.1";
  int port = 5000;
};

// What makes `options` unusable (a relative path, a path with a character the
// configuration or the backend's command line cannot carry, a socket path too
// long for a unix socket, a limit out of range); empty when they are usable.
std::string WebConfigProblem(const WebConfigOptions& options);

// kivo-webd's listening socket for `options`: one per web server (its port),
// under the root's run/kivo (the web server appends "-0").
std::string WebdSocketPath(const WebConfigOptions& options);

// The lighttpd configuration text for usable `options`. It keeps lighttpd in
// the foreground's terms: errors on stderr, no pid file, no user switch. In
// scgi mode lighttpd starts kivo-webd itself, hands it the listening socket
// and starts it again when it ends. lighttpd reads every request body whole
// before the web API sees it, uploads excepted, and refuses bodies over the
// web API's own limits (docs/scgi.md, docs/http-api.md).
std::string KIVOWebConfig(const WebConfigOptions& options);

// "cgi" / "scgi" to a mode; false for anything else.
bool ParseWebMode(const std::string& text, WebMode* mode);
