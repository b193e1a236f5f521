#include "server_report.h"

#include <stdlib.h>
#include <time.h>

#include <memory>
#include <string>

#include "S2S/is_syncedshare.h"
#include "karo_root.h"
#include "karo_section.h"
#include "karo_share.h"
#include "server_daemon.h"

namespace s2s_tools {

namespace {

struct ListFree {
  void operator()(KSZLIST* l) const { KLIBCSzListFree(l); }
};
struct HashFree {
  void operator()(KSZHASH* h) const { KLIBCSzHashFree(h); }
};
using List = std::unique_ptr<KSZLIST, ListFree>;
using Hash = std::unique_ptr<KSZHASH, HashFree>;

std::string RegistryPath() {
  return KaroRootPath("/usr/karo/etc/karoS2S.info");
}

std::string ShareValue(const std::string& share, const char* key) {
  char buf[256] = "";
  if (S2SServerGetShare(share.c_str(), key, buf, sizeof buf) < 0) return "";
  return buf;
}

const char* OrDash(const char* s) { return s != nullptr && *s ? s : "-"; }

std::string TaskStatus(const char* status) {
  if (status == nullptr || *status == '\0') return "-";
  std::string s = status;
  if (s == "idle") return s;
  long long t = atoll(status);
  return "active " + std::to_string(static_cast<long long>(time(nullptr)) - t) +
         " s ago";
}

}  // namespace

int PrintStatus(FILE* out) {
  S2S_SVR_STATUS st = {};
  s2s_svr_get_status(&st);
  fprintf(out, "service:  %s, %s\n", st.running ? "running" : "not running",
          st.busy ? "busy" : "idle");
  fprintf(out, "paired:   client %s, server name %s\n", OrDash(st.clientID),
          OrDash(st.serverName));
  s2s_svr_put_status(&st);
  pid_t pid = -1;
  int port = 0;
  if (ServerDaemonRunning(pid, port)) {
    fprintf(out, "daemon:   pid %ld, port %d\n", static_cast<long>(pid), port);
  } else {
    fprintf(out, "daemon:   not running\n");
  }
  List shares(KLIBCSzListAlloc());
  int count = shares ? KAROShareEnum(shares.get()) : -1;
  for (int i = 0; i < count; ++i) {
    std::string name = KLIBCSzListGet(shares.get(), i);
    std::string running = ShareValue(name, "RunningID");
    std::string complete = ShareValue(name, "CompleteID");
    fprintf(out, "share %-16s running %s, last completed by %s\n", name.c_str(),
            running.empty() ? "-" : running.c_str(),
            complete.empty() ? "-" : complete.c_str());
  }
  List sections(KLIBCSzListAlloc());
  count = sections
              ? KLIBCFileEnumSection(RegistryPath().c_str(), sections.get())
              : -1;
  for (int i = 0; i < count; ++i) {
    std::string section = KLIBCSzListGet(sections.get(), i);
    if (section.compare(0, 5, "TASK_") != 0) continue;
    Hash h(KLIBCSzHashAlloc(64));
    if (!h || S2SGetServerInfo(section.c_str(), h.get()) < 0) continue;
    fprintf(out, "task  %-16s %s\n", section.substr(5).c_str(),
            TaskStatus(KLIBCSzHashGetValue(h.get(), "status")).c_str());
  }
  return 0;
}

int PrintPairings(FILE* out) {
  List sections(KLIBCSzListAlloc());
  int count = sections
                  ? KLIBCFileEnumSection(RegistryPath().c_str(), sections.get())
                  : -1;
  if (count < 0) return -1;
  for (int i = 0; i < count; ++i) {
    const char* section = KLIBCSzListGet(sections.get(), i);
    Hash h(KLIBCSzHashAlloc(256));
    if (!h || S2SGetServerInfo(section, h.get()) < 0) return -1;
    fprintf(out, "[%s]\n", section);
    for (int k = 0; k < KLIBCSzHashCount(h.get()); ++k) {
      fprintf(out, "\t%s=\"%s\"\n", KLIBCSzHashKeyAt(h.get(), k),
              KLIBCSzHashValueAt(h.get(), k));
    }
  }
  return 0;
}

}  // namespace s2s_tools
