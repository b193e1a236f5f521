/* Platform error state: one thread-local "last platform error" number.
 *
 * Every platform call that fails sets it; callers read it with KLIBCErrGet()
 * right after the failing call. Numbers are 16-bit values of the form 0xNN00;
 * the ones this layer produces are listed below. Thread-safe: each thread has
 * its own value. */
#ifndef KARO_ERR_H_
#define KARO_ERR_H_

#ifdef __cplusplus
extern "C" {
#endif

enum {
  KERR_NONE = 0x0000,
  KERR_SYSTEM = 0x0100,           /* a system call failed; errno tells more */
  KERR_NO_MEMORY = 0x0200,        /* allocation failed */
  KERR_INVALID_ARG = 0x0D00,      /* null, empty or malformed argument */
  KERR_FILE_NOT_FOUND = 0x2000,   /* the file does not exist */
  KERR_FILE_FORMAT = 0x2100,      /* the file exists but cannot be parsed */
  KERR_NOT_FOUND = 0x2200,        /* no such section, key, share or volume */
  KERR_VALUE_UNHOLDABLE = 0x2300, /* key or value the file format cannot hold */
  KERR_BUFFER_TOO_SMALL =
      0x2400,         /* the result does not fit the caller's buffer */
  KERR_LOCK = 0x3000, /* semaphore could not be opened or taken */
  KERR_SERVICE_RUNNING = 0xEB00, /* start of a service that already runs */
  KERR_SERVICE = 0xEC00 /* the service could not be started or paused */
};

/* Returns the calling thread's last platform error (0 when none was set). */
int KLIBCErrGet(void);

/* Sets the calling thread's last platform error. `source` and `line` name the
 * place that detected it; they are kept for KLIBCErrSource(). */
void KLIBCErrSetEx(int err, const char* source, int line);

/* Same as KLIBCErrSetEx with this file and line. */
#define KLIBCErrSet(err) KLIBCErrSetEx((err), __FILE__, __LINE__)

/* Returns "source:line" of the last KLIBCErrSetEx on this thread, or "". */
const char* KLIBCErrSource(void);

#ifdef __cplusplus
}
#endif

#endif /* KARO_ERR_H_ */
