// The web server configuration that serves the web API of a system root:
// lighttpd on one address and port, the web API at /webapi/entry.cgi, run
// either as a CGI program per request or by kivo-webd behind lighttpd's SCGI
// module (a forked child per request, no program start).
#pragma once

#include <string>

enum class WebMode { kCgi, kScgi };

struct WebConfigOptions {
  std::string root;  // the system root (KIVO_ROOT of every request)
  WebMode mode = WebMode::kCgi;
  std::string entry_cgi;          // cgi: absolute path of entry.cgi
  std::string webd;               // scgi: absolute path of kivo-webd
  int max_children = 16;          // scgi: requests served at once; more wait
  int read_timeout_seconds = 30;  // scgi: a request's limit without a byte from its client
  std::string module_dir;         // the modules folder; empty: the one beside the program
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
// and starts it again when it ends.
std::string KIVOWebConfig(const WebConfigOptions& options);

// "cgi" / "scgi" to a mode; false for anything else.
bool ParseWebMode(const std::string& text, WebMode* mode);
