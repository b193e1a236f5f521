/* Internal: starting a child program, shared by KLIBCPopen and the service
 * calls. Not part of the C API. */
#ifndef KARO_SPAWN_H_
#define KARO_SPAWN_H_

#include <sys/types.h>

namespace karo_detail {

// Descriptor values for Spawn: the child gets /dev/null, or keeps the
// parent's descriptor.
constexpr int kDevNull = -1;
constexpr int kInherit = -2;

// Runs argv[0] (searched along PATH) with `argv` (NULL-terminated) and the
// given descriptors as its standard input, output and error. With `detach`
// the program runs in a session of its own as a grandchild, so that it is
// never left as a zombie of the caller. Returns the program's pid once
// exec has succeeded, or -1 with the platform error set: KERR_NOT_FOUND when
// the program cannot be executed, KERR_SYSTEM when pipe or fork fail.
pid_t Spawn(const char* const argv[], int in_fd, int out_fd, int err_fd,
            bool detach);

}  // namespace karo_detail

#endif  // KARO_SPAWN_H_
