/* Processes of the host platform layer: running a program with an argument
 * vector and reading its output, and telling whether the process named by a
 * pid file is alive.
 *
 * Programs are always started with an argument vector (execvp, searched along
 * PATH), never through a shell, so no argument is ever interpreted. The
 * child's standard input is /dev/null and its standard error is inherited.
 *
 * Every failure returns -1 (or NULL) and sets the platform error
 * (karo_err.h). Thread-safe: the table of open pipes is guarded by a mutex,
 * and every descriptor is created close-on-exec so that a child started on
 * one thread never inherits another thread's pipe. */
#ifndef KARO_PROCESS_H_
#define KARO_PROCESS_H_

#include <stdio.h>
#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Starts `prog` with the arguments that follow (a NULL-terminated list of
 * const char*; argv[0] is `prog` itself). `mode` is "r" (read the child's
 * standard output) or "w" (write to its standard input). Returns the stream,
 * to be closed with KLIBCPclose, or NULL: KERR_INVALID_ARG (null program or
 * bad mode), KERR_NOT_FOUND (the program cannot be found or executed),
 * KERR_SYSTEM (pipe or fork failed). A program that cannot be executed is
 * reported here rather than as an exit status, because no shell stands in
 * between. */
FILE* KLIBCPopen(const char* prog, const char* mode, ...);

/* Closes a stream from KLIBCPopen and waits for its child; a child whose
 * stream saw a read error (a signal interrupted the reader), or whose wait a
 * signal interrupts, gets SIGTERM first. Returns the
 * child's exit status (0-255, or 128 + the signal that ended it), or -1 with
 * KERR_INVALID_ARG for a stream that KLIBCPopen did not return. */
int KLIBCPclose(FILE* stream);

/* 1 when the pid file at `path` (used as given) names a live process, else 0:
 * a missing or unreadable file (KERR_FILE_NOT_FOUND), a malformed one
 * (KERR_FILE_FORMAT) or a process that has gone or is a zombie
 * (KERR_NOT_FOUND). */
int KLIBCProcAliveByPidFile(const char* path);

/* The pid written in the pid file at `path`, or -1 as for
 * KLIBCProcAliveByPidFile. */
pid_t KaroReadPidFile(const char* path);

#ifdef __cplusplus
}
#endif

#endif /* KARO_PROCESS_H_ */
