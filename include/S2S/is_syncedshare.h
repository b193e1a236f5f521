/* Server pairing registry: the unmangled C functions over the registry file
 * "/usr/karo/etc/karoS2S.info" (under the root prefix of S2S_ROOT) of the
 * appliance that receives synced shares.
 *
 * The file holds the sections "PairedClientInfo" (keys "s2sEnabled",
 * "clientID", "serverName"), "SHARE_<share>" ("RunningID", "CompleteID", ...),
 * "TASK_<task>" ("status": "idle" or the epoch seconds of the last activity)
 * and "CLIENTID_<client>" ("ServerName"). Every write, in every process, is
 * serialised on a System V semaphore (key 0x2980298 for the real root, a key
 * derived from the root's path for a relocated one) and replaces the file
 * atomically; reads take no lock. A writer waits at most 30 seconds for the
 * lock and then fails. Failures are logged to the system log at
 * LOG_ERR. A name or value that the file cannot hold (a line break; in names
 * also '[' or ']') is refused and nothing is written.
 *
 * Sections travel as string hashes. C programs build them with the
 * KLIBCSzHash calls below, and receive share names in string lists; both are
 * exported by libs2s for that purpose. Strings returned by a hash or list
 * belong to it. All functions may be called from any thread; hashes and
 * lists are used by one thread at a time. */
#ifndef S2S_IS_SYNCEDSHARE_H_
#define S2S_IS_SYNCEDSHARE_H_

#include "S2S/export.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- String hashes and lists (see the platform layer's section calls). */
typedef struct KSZHASH KSZHASH;
typedef struct KSZLIST KSZLIST;

/* An empty insertion-ordered hash of at most `capacity` keys, or NULL. */
S2S_EXPORT KSZHASH* KLIBCSzHashAlloc(int capacity);
S2S_EXPORT void KLIBCSzHashFree(KSZHASH* hash);
/* Sets `key` to a copy of `value`; 0, or -1 (null argument, hash full). */
S2S_EXPORT int KLIBCSzHashSetValue(KSZHASH* hash, const char* key,
                                   const char* value);
/* The value of `key`, or NULL when absent. */
S2S_EXPORT const char* KLIBCSzHashGetValue(const KSZHASH* hash,
                                           const char* key);
S2S_EXPORT int KLIBCSzHashCount(const KSZHASH* hash);
/* Key and value of the i-th pair in insertion order, or NULL. */
S2S_EXPORT const char* KLIBCSzHashKeyAt(const KSZHASH* hash, int i);
S2S_EXPORT const char* KLIBCSzHashValueAt(const KSZHASH* hash, int i);

/* An empty list, or NULL. */
S2S_EXPORT KSZLIST* KLIBCSzListAlloc(void);
S2S_EXPORT void KLIBCSzListFree(KSZLIST* list);
/* Appends a copy of `s`; 0, or -1. */
S2S_EXPORT int KLIBCSzListPush(KSZLIST* list, const char* s);
S2S_EXPORT int KLIBCSzListCount(const KSZLIST* list);
/* The i-th string, or NULL when out of range. */
S2S_EXPORT const char* KLIBCSzListGet(const KSZLIST* list, int i);

/* ---- Registry file and server info. */

/* The value of "clientID" and "serverName" in many-client mode. */
#define S2S_MULTI_SRC_MARKER "S2SMULTI-SRC-SUPPORT"

/* Switches the service on (`enable` nonzero) or off in "s2sEnabled"; when both
 * `clientID` and `serverName` are non-null they replace the stored pairing,
 * otherwise it is kept. 0, or -1. */
S2S_EXPORT int KAROUISetS2S(int enable, const char* clientID,
                            const char* serverName);

/* 1 when the service is not switched off and the share's "RunningID" is
 * non-empty, else 0 (also for a null or empty name, with platform error
 * 0x0D00, and for a missing registry). */
S2S_EXPORT int KAROS2SIsSyncedShare(const char* shareName);

/* Creates the registry file (mode 0644) when it is missing. 0 when it exists
 * or was created, -1. */
S2S_EXPORT int S2SCheckServerInfo(void);

/* Adds the pairs of `section` to `out`: 1 when the section exists, 0 when it
 * does not, negative on failure. */
S2S_EXPORT int S2SGetServerInfo(const char* section, KSZHASH* out);

/* Replaces `section` with `values`, or appends it when it is new. 0, or -1. */
S2S_EXPORT int S2SUpdateServerInfo(const char* section, const KSZHASH* values);

/* Holds the registry lock for the calling thread until S2SRegistryUnlock,
 * waiting at most `timeoutMs` milliseconds (negative: the default 30 s). The
 * registry functions this thread calls meanwhile do not wait for it again,
 * so that a check and the write it leads to happen under one lock. Calls
 * nest. 0, or -1 when the lock could not be had in time. */
S2S_EXPORT int S2SRegistryLock(int timeoutMs);
/* Releases the latest S2SRegistryLock of this thread. 0, or -1 when it holds
 * none. */
S2S_EXPORT int S2SRegistryUnlock(void);

/* ---- Pair records and status. */

/* Result numbers of the pairing functions. */
enum {
  S2S_SVR_OK = 0,
  S2S_SVR_NO_MEMORY = 200,    /* a hash could not be allocated */
  S2S_SVR_BAD_ARGUMENT = 201, /* bad or missing argument */
  S2S_SVR_VALUE_ERROR = 202,  /* a value could not be read or set */
  S2S_SVR_WRITE_ERROR = 205,  /* writing the registry failed */
  S2S_SVR_READ_ERROR = 206    /* the registry could not be read */
};

/* Copies `key` of section "SHARE_<share>" into `buffer` (`size` bytes).
 * Returns the value's length, or -1 (null argument, no such section or key,
 * buffer too small, unreadable registry). */
S2S_EXPORT int S2SServerGetShare(const char* share, const char* key,
                                 char* buffer, int size);

/* S2SUpdateServerInfo of section "SHARE_<share>" / "TASK_<task>": 0, or -1
 * (also for a null or empty name). */
S2S_EXPORT int S2SServerUpdateShare(const char* share, const KSZHASH* values);
S2S_EXPORT int S2SServerUpdateTask(const char* task, const KSZHASH* values);

/* 1 when the server is bound to one client of the older single-client kind
 * ("clientID" and "serverName" set and not both the marker), 0 when not, -1
 * when the registry cannot be read. */
S2S_EXPORT int S2SServerIfOldClientPaired(void);

/* Stores "clientID" and "serverName" of `values` in "PairedClientInfo".
 * 0, or 201 (null), 200, 206 (unreadable), 202 (a key missing), 205. */
S2S_EXPORT int S2SServerSetPairValue(const KSZHASH* values);

/* Remembers `serverName` in "CLIENTID_<clientID>" and switches the server to
 * many-client mode. 0, or 201 (null or empty argument; nothing written),
 * 200, 202, 205. */
S2S_EXPORT int S2SServerUpdatePairInfo(const char* clientID,
                                       const char* serverName);

/* Sorts `shares` for a pairing request of `clientID`. A share's feeder is its
 * "RunningID" when that is non-empty, else its "CompleteID". A share without
 * a feeder goes to `freeShares`; one fed by `clientID` to `ownShares`; one
 * fed by any other client to `conflictShares`, which the server refuses: a
 * share accepts one writer, so a second client cannot pair it while another
 * runs a sync into it or was the last to complete one. Names are appended in
 * list order. Returns 0; 201 when an argument is null or empty (the lists,
 * `clientID`, a share name); 206 when a share record cannot be read (what
 * was sorted before stays in the lists). */
S2S_EXPORT int S2SCheckIfSharePaired(const KSZLIST* shares,
                                     const char* clientID, KSZLIST* freeShares,
                                     KSZLIST* ownShares,
                                     KSZLIST* conflictShares);

/* The service status, filled by s2s_svr_get_status. */
typedef struct S2S_SVR_STATUS {
  int running;      /* service on and the rsync daemon alive */
  int busy;         /* a task was active in the last 119 seconds */
  char* clientID;   /* copy of "clientID", or NULL */
  char* serverName; /* copy of "serverName", or NULL */
} S2S_SVR_STATUS;

/* Fills `status` afresh; release it with s2s_svr_put_status. Returns 0 (a
 * null `status` is ignored). */
S2S_EXPORT int s2s_svr_get_status(S2S_SVR_STATUS* status);
/* Releases the strings of `status` and sets them to NULL; 0. */
S2S_EXPORT int s2s_svr_put_status(S2S_SVR_STATUS* status);

/* Forgets the single paired client (remembering its server name in
 * "CLIENTID_<client>") and switches to many-client mode. 0, or -1. */
S2S_EXPORT int s2s_svr_reset_pair(void);

#ifdef __cplusplus
}
#endif

#endif /* S2S_IS_SYNCEDSHARE_H_ */
