// One request's process under kivo-webd: the forked child that turns an SCGI
// connection into a CGI environment, stdin and stdout and runs entry.cgi's
// request code.
#pragma once

// Serves the request on connection `conn` and ends the process; never
// returns. The caller has closed every descriptor of the server (listening
// socket, signal descriptor) and restored default signal handling.
//
// A receive time limit of `read_timeout_seconds` without a byte bounds each
// read of the connection, so a client that never sends its body ends only
// its own request. The SCGI head is read byte-exactly (the body stays in the
// socket for the request code); the environment is cleared and set to the
// head's variables, which are those a CGI program gets from the web server;
// the connection becomes stdin and stdout (stderr stays the server's, the web
// server's error log). A head that cannot be read ends the child without an
// answer, which the web server reports as a failed request. The child ends
// with _exit once stdout is flushed: the libraries' exit handlers and static
// destructors do not run.
[[noreturn]] void ServeScgiConnection(int conn, int read_timeout_seconds);
