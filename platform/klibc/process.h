// Running programs and forking workers.
//
// Programs are run directly with execv, never through a shell, so an
// argument is one word whatever it holds. A web API request answers on
// stdout, so a program started here writes its stdout to our stderr (the
// log) unless the caller reads it through KLIBCPopen.
#pragma once

#include <cstdio>
#include <sys/types.h>

// Runs `path` with up to four arguments (a null argument ends the list) and
// waits for it. Returns its exit status (0..255), 128 + signal number when a
// signal ended it, or -1 (last error KLIBC_ERR_EXEC) when it could not run.
[[nodiscard]] int KLIBCExec(const char* path, const char* arg1, const char* arg2, const char* arg3,
                            const char* arg4);

// Starts `path` with up to four arguments and returns a stream of its
// standard output (mode "r") or of its standard input (mode "w"); null when
// it cannot be started. Close it with KLIBCPclose, which waits for the
// program and returns its status as KLIBCExec does.
[[nodiscard]] FILE* KLIBCPopen(const char* path, const char* mode, const char* arg1,
                               const char* arg2, const char* arg3, const char* arg4);
[[nodiscard]] int KLIBCPclose(FILE* stream);

// fork() after flushing every stdio stream, so buffered output is not written
// twice. Returns what fork returns. A forked child that must not answer the
// request ends with _exit.
[[nodiscard]] pid_t KLIBCProcFork();

// 1 when the process `pid` exists and is not a zombie, 0 otherwise.
int KLIBCProcAlive(pid_t pid);
