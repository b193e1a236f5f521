/* Calls the registry through its C header and the shared library, the way a
 * C program of the appliance would. Exits 0 when every check passes. */
#define _XOPEN_SOURCE 700
#include <ftw.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "S2S/is_syncedshare.h"

static int failures = 0;

#define CHECK(cond)                                                            \
  do {                                                                         \
    if (!(cond)) {                                                             \
      fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, __LINE__, #cond); \
      ++failures;                                                              \
    }                                                                          \
  } while (0)

static int RemoveEntry(const char* path, const struct stat* st, int flag,
                       struct FTW* ftw) {
  (void)st, (void)flag, (void)ftw;
  return remove(path);
}

int main(void) {
  char root[] = "/tmp/s2s-c-test.XXXXXX";
  if (mkdtemp(root) == NULL) return 1;
  setenv("S2S_ROOT", root, 1);

  CHECK(KAROUISetS2S(1, "client-1", "server-1") == 0);
  KSZHASH* share = KLIBCSzHashAlloc(8);
  CHECK(KLIBCSzHashSetValue(share, "RunningID", "client-1") == 0);
  CHECK(S2SServerUpdateShare("docs", share) == 0);
  CHECK(KAROS2SIsSyncedShare("docs") == 1);
  char buf[64];
  CHECK(S2SServerGetShare("docs", "RunningID", buf, sizeof buf) == 8);
  CHECK(strcmp(buf, "client-1") == 0);
  CHECK(S2SServerUpdatePairInfo("client-1", "server-1") == S2S_SVR_OK);
  S2S_SVR_STATUS status;
  CHECK(s2s_svr_get_status(&status) == 0);
  CHECK(status.clientID != NULL &&
        strcmp(status.clientID, S2S_MULTI_SRC_MARKER) == 0);
  CHECK(s2s_svr_put_status(&status) == 0);

  KLIBCSzHashFree(share);
  if (nftw(root, RemoveEntry, 16, FTW_DEPTH | FTW_PHYS) != 0) ++failures;
  return failures == 0 ? 0 : 1;
}
