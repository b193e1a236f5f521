// Pair records: share and task sections, the paired client, the move to
// many-client mode, and which shares a client may pair.
#include <string.h>
#include <syslog.h>

#include <string>

#include "S2S/is_syncedshare.h"
#include "S2S/is_syncedshare_detail.h"
#include "S2S/syslog_sink.h"
#include "karo_err.h"

namespace {

using S2S::detail::HashPtr;
using S2S::detail::kMultiSrcMarker;
using S2S::detail::RegistryLock;
using S2S::detail::RegistryPtr;
using S2S::detail::SectionDoc;
using S2S::detail::StrPtr;
using S2S::detail::Syslog;

bool Empty(const char* s) { return s == nullptr || s[0] == '\0'; }

// S2SUpdateServerInfo of section `prefix` + `name`; -1 when the name is
// missing or the section name cannot be built.
int UpdateNamed(const char* prefix, const char* name, const KSZHASH* values) {
  if (Empty(name)) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  StrPtr section(KLIBCStrGet("%s%s", prefix, name));
  if (!section) return -1;
  return S2SUpdateServerInfo(section.get(), values);
}

// Reads `key` of the share's section of `doc` (nullptr: the registry could
// not be read); a share without that record reads as "". false (logged) when
// the registry cannot be read.
bool ReadShareKey(const SectionDoc* doc, const char* share, const char* key,
                  char* buf, int size) {
  const std::string section = std::string("SHARE_") + share;
  if (doc != nullptr && doc->CopyValue(section, key, buf, size) >= 0) {
    return true;
  }
  buf[0] = '\0';
  int err = KLIBCErrGet();
  if (err == KERR_NOT_FOUND || err == KERR_FILE_NOT_FOUND) return true;
  if (strcmp(key, "CompleteID") == 0) {
    Syslog(LOG_ERR, "Failed to get section [%s] CompleteID value.",
           section.c_str());
  } else {
    Syslog(LOG_ERR, "Failed to get section [%s] RunningID value.",
           section.c_str());
  }
  return false;
}

// The ids that complete and run syncs into `share`. 0, 201 or 206.
int getSharePairStatus(const SectionDoc* doc, const char* share, char* complete,
                       char* running, int size) {
  if (Empty(share)) {
    Syslog(LOG_ERR, "Parameter error on getSharePairStatus.");
    return S2S_SVR_BAD_ARGUMENT;
  }
  if (!ReadShareKey(doc, share, "CompleteID", complete, size) ||
      !ReadShareKey(doc, share, "RunningID", running, size)) {
    return S2S_SVR_READ_ERROR;
  }
  return S2S_SVR_OK;
}

enum class PairClass { kFree, kOwn, kConflict };

// The share's feeder is the client running a sync into it, else the last to
// complete one; only the feeder (or anyone, when there is none) may pair it.
bool canClientPairTheShare(const char* client, const char* complete,
                           const char* running, PairClass* out) {
  if (Empty(client) || complete == nullptr || running == nullptr) {
    Syslog(LOG_ERR, "Parameter error on canClientPairTheShare.");
    return false;
  }
  const char* feeder = running[0] != '\0' ? running : complete;
  if (feeder[0] == '\0') {
    *out = PairClass::kFree;
  } else {
    *out = strcmp(feeder, client) == 0 ? PairClass::kOwn : PairClass::kConflict;
  }
  return true;
}

}  // namespace

extern "C" int S2SServerGetShare(const char* share, const char* key,
                                 char* buffer, int size) {
  if (share == nullptr || key == nullptr || buffer == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  StrPtr section(KLIBCStrGet("SHARE_%s", share));
  if (!section) return -1;
  if (size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  RegistryPtr doc = S2S::detail::ReadRegistry();
  if (!doc) return -1;
  return doc->CopyValue(section.get(), key, buffer, size);
}

extern "C" int S2SServerUpdateShare(const char* share, const KSZHASH* values) {
  return UpdateNamed("SHARE_", share, values);
}

extern "C" int S2SServerUpdateTask(const char* task, const KSZHASH* values) {
  return UpdateNamed("TASK_", task, values);
}

extern "C" int S2SServerIfOldClientPaired(void) {
  HashPtr hash(KLIBCSzHashAlloc(1024));
  if (!hash) {
    Syslog(LOG_ERR, "Failed to allocate memory of hash.");
    return -1;
  }
  if (S2SGetServerInfo(S2S::detail::kPairedClientInfo, hash.get()) < 0) {
    Syslog(LOG_ERR, "Get server paired-info error.");
    return -1;
  }
  const char* client = KLIBCSzHashGetValue(hash.get(), "clientID");
  const char* server = KLIBCSzHashGetValue(hash.get(), "serverName");
  if (Empty(client) || Empty(server)) return 0;
  return strcmp(client, kMultiSrcMarker) == 0 &&
                 strcmp(server, kMultiSrcMarker) == 0
             ? 0
             : 1;
}

extern "C" int S2SServerSetPairValue(const KSZHASH* values) {
  if (values == nullptr) return S2S_SVR_BAD_ARGUMENT;
  // Read and written back under one lock: the other keys of the section
  // ("s2sEnabled") may be changed by another process meanwhile.
  RegistryLock lock;
  if (!lock.Held()) {
    Syslog(LOG_ERR, "S2SUpdateServerInfo() lock failed");
    return S2S_SVR_WRITE_ERROR;
  }
  HashPtr section(KLIBCSzHashAlloc(1024));
  if (!section) return S2S_SVR_NO_MEMORY;
  if (S2SGetServerInfo(S2S::detail::kPairedClientInfo, section.get()) < 0) {
    return S2S_SVR_READ_ERROR;
  }
  const char* client = KLIBCSzHashGetValue(values, "clientID");
  const char* server = KLIBCSzHashGetValue(values, "serverName");
  if (client == nullptr || server == nullptr) return S2S_SVR_VALUE_ERROR;
  if (KLIBCSzHashSetValue(section.get(), "clientID", client) != 0 ||
      KLIBCSzHashSetValue(section.get(), "serverName", server) != 0) {
    return S2S_SVR_VALUE_ERROR;
  }
  if (S2S::detail::UpdateServerInfoLocked(S2S::detail::kPairedClientInfo,
                                          section.get()) != 0) {
    return S2S_SVR_WRITE_ERROR;
  }
  return S2S_SVR_OK;
}

extern "C" int S2SServerUpdatePairInfo(const char* clientID,
                                       const char* serverName) {
  if (Empty(clientID) || Empty(serverName)) return S2S_SVR_BAD_ARGUMENT;
  HashPtr old_client(KLIBCSzHashAlloc(16));
  HashPtr multi(KLIBCSzHashAlloc(16));
  if (!old_client || !multi) return S2S_SVR_NO_MEMORY;
  if (KLIBCSzHashSetValue(old_client.get(), "ServerName", serverName) != 0) {
    return S2S_SVR_VALUE_ERROR;
  }
  if (UpdateNamed("CLIENTID_", clientID, old_client.get()) != 0) {
    return S2S_SVR_WRITE_ERROR;
  }
  if (KLIBCSzHashSetValue(multi.get(), "clientID", kMultiSrcMarker) != 0 ||
      KLIBCSzHashSetValue(multi.get(), "serverName", kMultiSrcMarker) != 0) {
    return S2S_SVR_VALUE_ERROR;
  }
  return S2SServerSetPairValue(multi.get()) != 0 ? S2S_SVR_WRITE_ERROR
                                                 : S2S_SVR_OK;
}

extern "C" int s2s_svr_reset_pair(void) {
  if (S2SCheckServerInfo() != 0) return -1;
  RegistryLock lock;
  if (!lock.Held()) return -1;
  RegistryPtr doc;
  HashPtr hash;
  if (!S2S::detail::LoadPairedClientInfo(&doc, &hash)) return -1;
  const char* client = KLIBCSzHashGetValue(hash.get(), "clientID");
  const char* server = KLIBCSzHashGetValue(hash.get(), "serverName");
  if (client == nullptr) {
    Syslog(LOG_ERR, "Failed to get clientID from hash.");
  } else if (server == nullptr) {
    Syslog(LOG_ERR, "Failed to get serverName from hash.");
  } else {
    // Remembered in the same write as the move to many-client mode.
    StrPtr section(KLIBCStrGet("CLIENTID_%s", client));
    HashPtr old_client(KLIBCSzHashAlloc(16));
    if (!section || !old_client ||
        KLIBCSzHashSetValue(old_client.get(), "ServerName", server) != 0 ||
        !S2S::detail::Holdable(section.get(), old_client.get())) {
      Syslog(LOG_ERR, "Failed to add section [%s].",
             section ? section.get() : client);
    } else {
      *doc->Add(section.get()) = {{"ServerName", server}};
    }
  }
  // `client` and `server` point into the hash: done with them above.
  if (KLIBCSzHashSetValue(hash.get(), "clientID", kMultiSrcMarker) != 0 ||
      KLIBCSzHashSetValue(hash.get(), "serverName", kMultiSrcMarker) != 0) {
    return -1;
  }
  return S2S::detail::StorePairedClientInfo(doc, hash.get());
}

extern "C" int S2SCheckIfSharePaired(const KSZLIST* shares,
                                     const char* clientID, KSZLIST* freeShares,
                                     KSZLIST* ownShares,
                                     KSZLIST* conflictShares) {
  if (KLIBCSzListCount(shares) == 0 || Empty(clientID) ||
      freeShares == nullptr || ownShares == nullptr ||
      conflictShares == nullptr) {
    Syslog(LOG_ERR, "Input parameters are null or empty!");
    return S2S_SVR_BAD_ARGUMENT;
  }
  // One read for every share of the list.
  RegistryPtr doc = S2S::detail::ReadRegistry();
  int read_error = doc ? 0 : KLIBCErrGet();
  for (int i = 0; i < KLIBCSzListCount(shares); ++i) {
    const char* share = KLIBCSzListGet(shares, i);
    char complete[256];
    char running[256];
    if (!doc) KLIBCErrSet(read_error);
    int ret = getSharePairStatus(doc.get(), share, complete, running,
                                 sizeof complete);
    if (ret != S2S_SVR_OK) {
      Syslog(LOG_ERR, "getSharePairStatus error");
      return ret;
    }
    PairClass cls;
    if (!canClientPairTheShare(clientID, complete, running, &cls)) {
      return S2S_SVR_BAD_ARGUMENT;
    }
    KSZLIST* out = cls == PairClass::kFree  ? freeShares
                   : cls == PairClass::kOwn ? ownShares
                                            : conflictShares;
    KLIBCSzListPush(out, share);
  }
  return S2S_SVR_OK;
}
