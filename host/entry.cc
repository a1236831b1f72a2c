// entry.cgi: the appliance's web API server program, run by the web server
// once per request (CGI). It reads the request, finds the API's row in the
// tables of the loaded modules, checks who is calling, runs the row's
// parameter checker and handler, and writes the JSON answer.

#include "host/entry_main.h"

// The request's deadline counts from the start of this program: the web
// server starts it once the head is in (and, but for uploads, the body).
int main() { return RunEntryRequest(RequestClock{MonotonicMs(), kDefaultRequestSeconds}); }
