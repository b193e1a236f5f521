/* The platform calls and the registry are C-callable: this program uses them
 * from C, the registry through the shared library, the way a C program of the
 * appliance would. Exits 0 when every check passes. */
#define _XOPEN_SOURCE 700
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "S2S/is_syncedshare.h"
#include "karo_err.h"
#include "karo_host.h"
#include "karo_net.h"
#include "karo_process.h"
#include "karo_service.h"
#include "karo_share.h"

static int failures = 0;

#define CHECK(cond)                                                          \
  ((cond) ? (void)0                                                          \
          : (void)(fprintf(stderr, "%s:%d: CHECK(%s)\n", __FILE__, __LINE__, \
                           #cond),                                           \
                   ++failures))

static char root[256];

static void WriteUnderRoot(const char* dir, const char* file,
                           const char* text) {
  char path[512];
  snprintf(path, sizeof path, "%s%s", root, dir);
  mkdir(path, 0755);
  snprintf(path, sizeof path, "%s%s/%s", root, dir, file);
  FILE* f = fopen(path, "w");
  if (f != NULL) {
    fputs(text, f);
    fclose(f);
  }
}

int main(void) {
  const char* tmp = getenv("TMPDIR");
  snprintf(root, sizeof root, "%s/s2s-ctest.XXXXXX", tmp ? tmp : "/tmp");
  if (mkdtemp(root) == NULL) return 1;
  setenv("S2S_ROOT", root, 1);
  WriteUnderRoot("/etc", "hosts", "127.0.0.9 server\n");
  WriteUnderRoot("/etc/s2s", "platform.conf",
                 "[Platform]\n\tserial=\"C-1\"\n\tlookup=\"hosts\"\n");
  WriteUnderRoot("/etc/s2s", "shares.conf",
                 "[docs]\n\tpath=\"/v/docs\"\n\tencrypted=\"yes\"\n");

  char buf[64];
  CHECK(KLIBGetSerialNumber(buf, sizeof buf) == 3 && strcmp(buf, "C-1") == 0);

  KARO_IPADDR ips[4];
  CHECK(KARONetLookupIP("server", ips, 4, 0) == 1);
  CHECK(strcmp(ips[0].addr, "127.0.0.9") == 0);

  KARO_SHARE* share = NULL;
  CHECK(KAROShareGet("docs", &share) == 0);
  CHECK(share != NULL && (share->status & KARO_SHARE_ENCRYPTED));
  KAROShareFree(share);

  FILE* p = KLIBCPopen("echo", "r", "hello", (const char*)NULL);
  CHECK(p != NULL && fgets(buf, sizeof buf, p) != NULL &&
        strcmp(buf, "hello\n") == 0);
  CHECK(p != NULL && KLIBCPclose(p) == 0);

  CHECK(KLIBServiceIsRunning("s2s_daemon") == 0);

  CHECK(KAROUISetS2S(1, "client-1", "server-1") == 0);
  CHECK(KAROS2SIsSyncedShare("docs") == 0);
  S2S_SVR_STATUS status;
  CHECK(s2s_svr_get_status(&status) == 0);
  CHECK(status.clientID != NULL && strcmp(status.clientID, "client-1") == 0);
  CHECK(s2s_svr_put_status(&status) == 0);

  p = KLIBCPopen("rm", "r", "-rf", root, (const char*)NULL);
  if (p == NULL || KLIBCPclose(p) != 0) ++failures;
  return failures == 0 ? 0 : 1;
}
