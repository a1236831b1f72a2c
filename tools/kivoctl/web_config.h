// The web server configuration that serves the web API of a system root:
// lighttpd on one address and port, entry.cgi at /webapi/entry.cgi.
#pragma once

#include <string>

struct WebConfigOptions {
  std::string root;       // the system root (KIVO_ROOT of the CGI)
  std::string entry_cgi;  // absolute path of entry.cgi
  std::string address = "127.0.0.1";
  int port = 5000;
};

// The lighttpd configuration text. It keeps lighttpd in the foreground's
// terms: errors on stderr, no pid file, no user switch.
std::string KIVOWebConfig(const WebConfigOptions& options);
