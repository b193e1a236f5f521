/* Services of the host platform layer: the background programs of S2S,
 * started, watched and paused by name.
 *
 * One service is known, "s2s_daemon": the S2S client service started as
 * "<program> --foreground" in a session of its own, with standard input and
 * output on /dev/null, and the pid file /var/run/s2s_daemon.pid under the
 * root. The program is "daemon_program" of the platform configuration, else
 * "s2sd" as KaroProgramFind finds it (karo_programs.h). The program must
 * stay in the foreground: the pid file names the process that was started.
 *
 * Every failure returns -1 and sets the platform error (karo_err.h).
 * Thread-safe, but two processes starting one service at the same moment
 * are not kept apart. */
#ifndef KARO_SERVICE_H_
#define KARO_SERVICE_H_

#ifdef __cplusplus
extern "C" {
#endif

/* Longest wait, in milliseconds, for a service to end after SIGTERM before
 * KLIBServicePause sends SIGKILL. */
#define KARO_SERVICE_STOP_MS 10000

/* 1 when the service's pid file names a live process, else 0 (also for an
 * unknown service, with KERR_NOT_FOUND). */
int KLIBServiceIsRunning(const char* name);

/* Starts the service; `flags` must be 0. Returns 0 once the program has
 * been executed and its pid file written, or -1: KERR_SERVICE_RUNNING
 * (0xEB00, it already runs), KERR_SERVICE (the program is missing or cannot
 * be executed, or the pid file cannot be written), KERR_NOT_FOUND (unknown
 * service), KERR_INVALID_ARG. */
int KLIBServiceStart(const char* name, int flags);

/* Stops the service's process (SIGTERM, then SIGKILL after
 * KARO_SERVICE_STOP_MS) and removes its pid file; the service stays
 * configured and can be started again. A service that does not run is left
 * as it is. Returns 0, or -1: KERR_SERVICE (the process cannot be
 * signalled), KERR_NOT_FOUND (unknown service), KERR_INVALID_ARG. */
int KLIBServicePause(const char* name);

#ifdef __cplusplus
}
#endif

#endif /* KARO_SERVICE_H_ */
