#include "klibc/last_error.h"

namespace {
struct LastError {
  int err = 0;
  const char* file = "";
  int line = 0;
};
thread_local LastError g_last;
}  // namespace

int KLIBCErrGet() { return g_last.err; }
const char* KLIBCErrorGetFile() { return g_last.file; }
int KLIBCErrorGetLine() { return g_last.line; }

void KLIBCErrSetEx(int err, const char* file, int line) {
  g_last.err = err;
  g_last.file = file ? file : "";
  g_last.line = line;
}

void KLIBCErrClear() { g_last = LastError(); }
