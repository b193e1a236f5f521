// Where the programs take a password from: a private file or the
// environment, never the command line.
//
// A password file must be a regular file owned by the caller and readable
// by nobody else (no group or other bits), so that a secret is never read
// from a place others can see. Its first line is the password.
#ifndef S2S_TOOLS_SECRET_H_
#define S2S_TOOLS_SECRET_H_

#include <string>

namespace s2s_tools {

// The variable a password may come from instead of a file.
extern const char kPasswordEnv[];

// Reads the password from `path` when it is not empty, else from the
// variable kPasswordEnv, whose value is then overwritten in place and the
// variable removed, so that neither child processes nor /proc/PID/environ
// show it. A path naming anything but a regular file (a FIFO, a device) is
// refused without waiting on it. Returns true with `password` set, or
// false with `error` saying why (the password itself is never in it).
bool ReadPassword(const std::string& path, std::string& password,
                  std::string& error);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SECRET_H_
