// Umbrella header: every exported header of libs2s.
#ifndef S2S_S2S_H_
#define S2S_S2S_H_

#include "S2S/channel.h"
#include "S2S/export.h"
#include "S2S/ipc.h"
#include "S2S/is_syncedshare.h"
#include "S2S/logger.h"
#include "S2S/pobject.h"
#include "S2S/result_codes.h"
#include "S2S/rsyncer.h"
#include "S2S/s2s_address.h"
#include "S2S/s2s_host.h"
#include "S2S/s2s_lock.h"
#include "S2S/s2s_share.h"
#include "S2S/stream.h"
#include "S2S/sync_obj.h"

#endif  // S2S_S2S_H_
