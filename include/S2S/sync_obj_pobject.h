// Sync tasks as flat PObject maps, the form in which they travel between
// the service's processes.
//
// The map is flat: the task's keys, the server settings and the schedule
// keys stand side by side, only the share list is an array. The period
// travels as whole hours and minutes, so seconds of a period that is not a
// whole number of minutes are lost on the way. Nothing here validates or
// fails: values of the wrong kind read as PObject reads them (0, "").
// Thread-safety: none beyond that of the objects passed in.
#ifndef S2S_SYNC_OBJ_POBJECT_H_
#define S2S_SYNC_OBJ_POBJECT_H_

#include "S2S/export.h"
#include "S2S/pobject.h"
#include "S2S/sync_obj_task.h"

namespace S2S {

// Sets the task's keys ("name" to "repeat_times_in_day") on `out`; other
// keys already in `out` stay.
S2S_EXPORT void TaskInfo2PObj(const TaskInfo& info, PObject& out);
// Sets "id", then the keys of TaskInfo2PObj.
S2S_EXPORT void SyncTask2PObj(const SyncTask& task, PObject& out);

// Stores each server-setting key present in `in` into `info`; a field whose
// key is absent keeps its value.
S2S_EXPORT void PObj2SyncInfo(const PObject& in, SyncInfo& info);
// Rebuilds the task from `in`: the id only if "id" is present, every other
// field from its key or, when the key is absent, from the default. Call
// TaskInfo::Validate() afterwards.
S2S_EXPORT void PObj2SyncTask(const PObject& in, SyncTask& task);
// As above, and reads "status" and "sync_result" (0 when absent).
S2S_EXPORT void PObj2SyncTask(const PObject& in, SyncTask& task,
                              TASK_STATUS& status, TASK_RESULT& result);

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_POBJECT_H_
