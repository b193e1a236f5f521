/* Relocatable root. Every fixed path of the system (the registry file, the
 * share and platform configuration, /tmp/S2S, key files, pid files) is
 * resolved under one prefix taken from the environment variable S2S_ROOT;
 * unset or empty means the real "/". This is how a client and a server
 * appliance share one machine in tests and in the demo.
 *
 * The prefix is read at every call, so a test may change S2S_ROOT between
 * calls; children inherit it through the environment. */
#ifndef KARO_ROOT_H_
#define KARO_ROOT_H_

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define KARO_ROOT_ENV "S2S_ROOT"

/* Returns the root prefix without a trailing slash ("" for the real root). */
const char* KaroRootPrefix(void);

/* Writes prefix + `path` (an absolute path) into `out`. Returns 0, or -1 with
 * KERR_INVALID_ARG for a null or relative path, KERR_BUFFER_TOO_SMALL when
 * the result does not fit in `size` bytes. */
int KaroRootResolve(const char* path, char* out, size_t size);

#ifdef __cplusplus
}

#include <string>

/* C++ form of KaroRootResolve: prefix + `path`. */
inline std::string KaroRootPath(const std::string& path) {
  return std::string(KaroRootPrefix()) + path;
}
#endif

#endif /* KARO_ROOT_H_ */
