// What s2sctl shows a person: the daemon's replies as tables and lines.
// Each function takes the reply map (doc/service_protocol.md) and returns
// the text, ending in a line break; keys a reply lacks show as "-". Control
// characters in names and messages are shown as '?'.
#ifndef S2S_TOOLS_CTL_PRINT_H_
#define S2S_TOOLS_CTL_PRINT_H_

#include <string>

#include "S2S/pobject.h"

namespace s2s_tools {

// "list": one row per task.
std::string FormatTaskList(const S2S::PObject& reply);
// "get": one task's settings, a line each.
std::string FormatTask(const S2S::PObject& reply);
// "status": the service, its running tasks and next runs.
std::string FormatStatus(const S2S::PObject& reply);
// "history": a line per run, a line per share under it.
std::string FormatHistory(const S2S::PObject& reply);
// A dry run's run map (from "history"): per share what would be sent ("+")
// and deleted ("-").
std::string FormatDryRun(const S2S::PObject& run);

// A task map's schedule in words ("daily at 02:00", "manual", ...).
std::string ScheduleText(const S2S::PObject& task);
// Epoch seconds as local "YYYY-MM-DD HH:MM:SS"; 0 as "-".
std::string TimeText(unsigned long long epoch);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CTL_PRINT_H_
