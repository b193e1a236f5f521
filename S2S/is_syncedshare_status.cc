// The service status: switched on with a live rsync daemon, busy while some
// task was active in the last two minutes, and the paired client.
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <string>

#include "S2S/is_syncedshare.h"
#include "S2S/is_syncedshare_detail.h"
#include "karo_process.h"
#include "karo_root.h"

namespace {

const char kRsyncdPidFile[] = "/var/run/rsyncd.pid";
// A task whose last activity is at most this old counts as running.
const long kBusySeconds = 119;

char* CopyOrNull(const KSZHASH* hash, const char* key) {
  const char* value = KLIBCSzHashGetValue(hash, key);
  return value != nullptr ? KLIBCStrGet("%s", value) : nullptr;
}

bool AnyTaskBusy(const S2S::detail::SectionDoc& doc) {
  time_t now = time(nullptr);
  for (size_t i = 0; i < doc.Count(); ++i) {
    const std::string& name = doc.NameAt(i);
    if (name.compare(0, 5, "TASK_") != 0) continue;
    char status[64];
    if (doc.CopyValue(name, "status", status, sizeof status) < 0 ||
        strcmp(status, "idle") == 0) {
      continue;
    }
    long t = strtol(status, nullptr, 10);
    if (static_cast<long>(now) - t <= kBusySeconds) return true;
  }
  return false;
}

}  // namespace

extern "C" int s2s_svr_get_status(S2S_SVR_STATUS* status) {
  if (status == nullptr) return 0;
  status->running = 0;
  status->busy = 0;
  status->clientID = nullptr;
  status->serverName = nullptr;
  // One read for the pairing and the tasks.
  S2S::detail::RegistryPtr doc;
  S2S::detail::HashPtr hash;
  if (S2S::detail::LoadPairedClientInfo(&doc, &hash)) {
    const char* enabled = KLIBCSzHashGetValue(hash.get(), "s2sEnabled");
    if (enabled != nullptr && strcmp(enabled, "yes") == 0) {
      status->running =
          KLIBCProcAliveByPidFile(KaroRootPath(kRsyncdPidFile).c_str()) == 1;
    }
    status->clientID = CopyOrNull(hash.get(), "clientID");
    status->serverName = CopyOrNull(hash.get(), "serverName");
  }
  if (!doc) doc = S2S::detail::ReadRegistry();
  status->busy = doc && AnyTaskBusy(*doc) ? 1 : 0;
  return 0;
}

extern "C" int s2s_svr_put_status(S2S_SVR_STATUS* status) {
  if (status == nullptr) return 0;
  KLIBCStrPut(status->clientID);
  KLIBCStrPut(status->serverName);
  status->clientID = nullptr;
  status->serverName = nullptr;
  return 0;
}
