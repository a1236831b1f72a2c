// One web API request from the CGI environment, standard input and standard
// output: the whole of entry.cgi. entry.cgi runs it once; each child of
// kivo-webd runs it once after making the SCGI request its CGI environment,
// stdin and stdout, so both paths answer with the very same code.
#pragma once

#include "host/request_deadline.h"

// Reads the request (environment and stdin), finds the API's row in the
// tables of the loaded modules, checks who is calling, runs the row's
// parameter checker and handler, and writes the answer on stdout (unless the
// handler switched output off). The body must arrive by its deadline from
// `clock` (host/request_deadline.h). A worker process that a handler forked
// and that returns here ends with _exit(0) inside this call and writes
// nothing. Returns the process's exit status.
int RunEntryRequest(const RequestClock& clock);
