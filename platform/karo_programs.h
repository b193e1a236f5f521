/* Where the S2S programs are. The platform starts some of them itself (the
 * client service for "s2s_daemon", the command handler named in the rsync
 * daemon's configuration), and finds them relative to the code that asks:
 * beside the library or program (the build tree), else in the installed
 * layout of the prefix that holds it (bin, sbin, libexec/s2s), so an
 * installed tree works from any prefix. */
#ifndef KARO_PROGRAMS_H_
#define KARO_PROGRAMS_H_

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Writes the path of the executable program `name` (a plain file name such
 * as "s2s-client") into `out`. Searched, for the shared object holding this
 * code and then for the running program: the directory it lies in, then
 * PREFIX/bin, PREFIX/sbin and PREFIX/libexec/s2s, where PREFIX is that
 * directory less its installed subdirectory (lib, bin, sbin, ...). Returns
 * 0, or -1: KERR_INVALID_ARG (null or empty name, or one holding '/'),
 * KERR_NOT_FOUND (no executable of that name in any of those places),
 * KERR_BUFFER_TOO_SMALL (the path does not fit in `size` bytes). */
int KaroProgramFind(const char* name, char* out, size_t size);

#ifdef __cplusplus
}

#include <string>

/* C++ form of KaroProgramFind: the path, or "" when it is not found. */
std::string KaroProgramPath(const std::string& name);
#endif

#endif /* KARO_PROGRAMS_H_ */
