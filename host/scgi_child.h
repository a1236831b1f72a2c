// One request's process under kivo-webd: the forked child that turns an SCGI
// request into a CGI environment, stdin and stdout and runs entry.cgi's
// request code.
#pragma once

#include "host/request_deadline.h"
#include "host/scgi_request.h"

// Serves `request` (its head read, and its body too when request.reads_body())
// on connection `conn` and ends the process; never returns. The caller has
// closed every other descriptor of the server (listening socket, signal
// descriptor, other connections) and restored default signal handling.
//
// The environment is cleared and set to the head's variables, which are
// those a CGI program gets from the web server. stdin is the body: a memory
// file holding it when it was read already, else the connection itself,
// which the request code reads by its deadline from `clock`. stdout is the
// connection (stderr stays the server's, the web server's error log). The
// child ends with _exit once stdout is flushed: the libraries' exit handlers
// and static destructors do not run.
[[noreturn]] void ServeScgiConnection(int conn, const ScgiRequestReader& request,
                                      const RequestClock& clock);
