// The sync data model: shares and events, schedules, sync tasks, their
// mapping to PObject maps and their text dumps.
#ifndef S2S_SYNC_OBJ_H_
#define S2S_SYNC_OBJ_H_

#include "S2S/sync_obj_dump.h"
#include "S2S/sync_obj_pobject.h"
#include "S2S/sync_obj_schedule.h"
#include "S2S/sync_obj_share.h"
#include "S2S/sync_obj_task.h"

#endif  // S2S_SYNC_OBJ_H_
