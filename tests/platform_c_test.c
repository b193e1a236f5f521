/* The platform calls are C-callable: this program uses them from C. */
#define _XOPEN_SOURCE 700
#include <ftw.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "karo_err.h"
#include "karo_host.h"
#include "karo_net.h"
#include "karo_process.h"
#include "karo_service.h"
#include "karo_share.h"

static int failures = 0;

#define CHECK(cond)                                                     \
  do {                                                                  \
    if (!(cond)) {                                                      \
      fprintf(stderr, "%s:%d: CHECK(%s)\n", __FILE__, __LINE__, #cond); \
      ++failures;                                                       \
    }                                                                   \
  } while (0)

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

static int RemoveOne(const char* path, const struct stat* st, int flag,
                     struct FTW* ftw) {
  (void)st, (void)flag, (void)ftw;
  return remove(path);
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
  CHECK(KARONetLookupIP("other", ips, 4, 0) == 0);

  KARO_SHARE* share = NULL;
  CHECK(KAROShareGet("docs", &share) == 0);
  CHECK(share != NULL && (share->status & KARO_SHARE_ENCRYPTED));
  KAROShareFree(share);
  CHECK(KAROShareGet("a/b", &share) == -1 && KLIBCErrGet() == KERR_INVALID_ARG);

  FILE* p = KLIBCPopen("echo", "r", "hello", (const char*)NULL);
  CHECK(p != NULL && fgets(buf, sizeof buf, p) != NULL &&
        strcmp(buf, "hello\n") == 0);
  if (p != NULL) CHECK(KLIBCPclose(p) == 0);

  CHECK(KLIBServiceIsRunning("s2s_daemon") == 0);

  nftw(root, RemoveOne, 16, FTW_DEPTH | FTW_PHYS);
  return failures == 0 ? 0 : 1;
}
