// The task map that s2sctl sends with "add" and "update": s2s-client's task
// file (when given) under the command line's task options, and the password
// from a private file or the environment.
#ifndef S2S_TOOLS_CTL_TASK_H_
#define S2S_TOOLS_CTL_TASK_H_

#include <string>

#include "S2S/pobject.h"
#include "ctl_options.h"

namespace s2s_tools {

// Builds the "task" map of a request from `o`. For a new task (`adding`)
// the task file's settings and the library's defaults fill every key, and a
// password is required; for an edit only the keys the options (or the task
// file) name are sent, and a password only when a password file is named or
// S2S_PASSWORD is set. The task file's "port" is not a task setting (s2sd
// takes the port from its environment): it is ignored with a note in
// `note`. Returns true, or false with `error` in words (never holding the
// password).
bool BuildTaskMap(const CtlOptions& o, bool adding, S2S::PObject& task,
                  std::string& note, std::string& error);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CTL_TASK_H_
