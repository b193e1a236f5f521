/* Internal: reading the share configuration, shared by the share and volume
 * calls. Not part of the C API. */
#ifndef KARO_SHARE_CONF_H_
#define KARO_SHARE_CONF_H_

#include <string>

#include "karo_section.h"

namespace karo_detail {

// The share configuration's path under the root.
std::string ShareConfPath();

// Reads the section of share `name` into a new hash in *out (the caller
// frees it). Returns 0, or -1 with the platform error set (KERR_NOT_FOUND
// for a missing share).
int ReadShareSection(const char* name, KSZHASH** out);

// Finds the first share whose "path" is `path` (trailing slashes ignored)
// and hands its section back in *out, or sets *out to NULL when none is.
// Returns 0, or -1 when the configuration cannot be read (a missing file is
// no share, not a failure).
int FindShareByPath(const std::string& path, KSZHASH** out);

}  // namespace karo_detail

#endif  // KARO_SHARE_CONF_H_
