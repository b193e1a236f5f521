// Text dumps of the sync objects for logs and diagnostics.
//
// Each object is written as a block of lines, a dotted label padded to a
// fixed width, the value and std::endl. Padded numbers set the stream's
// fill to '0', which stays set afterwards. The password is never written.
// Each operator returns the stream it was given.
#ifndef S2S_SYNC_OBJ_DUMP_H_
#define S2S_SYNC_OBJ_DUMP_H_

#include <ostream>

#include "S2S/export.h"
#include "S2S/sync_obj_schedule.h"
#include "S2S/sync_obj_share.h"
#include "S2S/sync_obj_task.h"

namespace S2S {

S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Share& share);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Event& event);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const Schedule& s);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const SyncInfo& info);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const TaskInfo& info);
S2S_EXPORT std::ostream& operator<<(std::ostream& os, const SyncTask& task);

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_DUMP_H_
