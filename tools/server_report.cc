#include "server_report.h"

#include <stdlib.h>
#include <time.h>

#include <memory>
#include <string>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "daemon_config.h"
#include "json_writer.h"
#include "karo_process.h"
#include "karo_root.h"
#include "karo_section.h"
#include "karo_share.h"
#include "root_files.h"
#include "server_daemon.h"

namespace s2s_tools {

namespace {

std::string RegistryPath() {
  return KaroRootPath("/usr/karo/etc/karoS2S.info");
}

std::string ShareValue(const std::string& share, const char* key) {
  char buf[256] = "";
  if (S2SServerGetShare(share.c_str(), key, buf, sizeof buf) < 0) return "";
  return buf;
}

std::string Str(const char* s) { return s != nullptr ? s : ""; }
std::string OrDash(const std::string& s) { return s.empty() ? "-" : s; }

// The task's state in words, or its seconds since the last activity.
std::string TaskStatus(const std::string& status, long long* active_ago) {
  *active_ago = -1;
  if (status.empty() || status == "idle") return OrDash(status);
  *active_ago = static_cast<long long>(time(nullptr)) - atoll(status.c_str());
  return "active " + std::to_string(*active_ago) + " s ago";
}

struct ShareRow {
  std::string name, running, complete;
};
struct TaskRow {
  std::string name, status;
  long long active_ago;
};

}  // namespace

bool DaemonAlive(pid_t& pid, int& port) {
  if (ServerDaemonRunning(pid, port)) return true;
  std::string unit_pid = S2S::server::DaemonPidPath();
  port = 0;
  pid = KaroReadPidFile(unit_pid.c_str());
  return pid > 0 && KLIBCProcAliveByPidFile(unit_pid.c_str()) == 1;
}

int PrintStatus(FILE* out, bool json) {
  S2S_SVR_STATUS st = {};
  s2s_svr_get_status(&st);
  bool running = st.running != 0, busy = st.busy != 0;
  std::string client = Str(st.clientID), server_name = Str(st.serverName);
  s2s_svr_put_status(&st);
  // The marker in place of a client means the server takes several.
  bool several = client == S2S_MULTI_SRC_MARKER;
  pid_t pid = -1;
  int port = 0;
  bool daemon = DaemonAlive(pid, port);

  std::vector<ShareRow> shares;
  List names(KLIBCSzListAlloc());
  int count = names ? KAROShareEnum(names.get()) : -1;
  for (int i = 0; i < count; ++i) {
    std::string name = KLIBCSzListGet(names.get(), i);
    shares.push_back(
        {name, ShareValue(name, "RunningID"), ShareValue(name, "CompleteID")});
  }
  std::vector<TaskRow> tasks;
  List sections(KLIBCSzListAlloc());
  count = sections
              ? KLIBCFileEnumSection(RegistryPath().c_str(), sections.get())
              : -1;
  for (int i = 0; i < count; ++i) {
    std::string section = KLIBCSzListGet(sections.get(), i);
    if (section.compare(0, 5, "TASK_") != 0) continue;
    Hash h(KLIBCSzHashAlloc(64));
    if (!h || S2SGetServerInfo(section.c_str(), h.get()) < 0) continue;
    TaskRow t{section.substr(5), "", -1};
    t.status =
        TaskStatus(Str(KLIBCSzHashGetValue(h.get(), "status")), &t.active_ago);
    tasks.push_back(t);
  }

  if (json) {
    fprintf(out,
            "{\"service\": {\"running\": %s, \"busy\": %s, "
            "\"several_clients\": %s, \"client\": %s, \"server_name\": %s},\n"
            " \"daemon\": {\"running\": %s, \"pid\": %ld, \"port\": %d},\n"
            " \"shares\": [",
            running ? "true" : "false", busy ? "true" : "false",
            several ? "true" : "false",
            JsonString(several ? "" : client).c_str(),
            JsonString(several ? "" : server_name).c_str(),
            daemon ? "true" : "false", daemon ? static_cast<long>(pid) : 0L,
            daemon ? port : 0);
    for (size_t i = 0; i < shares.size(); ++i) {
      fprintf(out, "%s{\"name\": %s, \"running\": %s, \"completed_by\": %s}",
              i ? ", " : "", JsonString(shares[i].name).c_str(),
              JsonString(shares[i].running).c_str(),
              JsonString(shares[i].complete).c_str());
    }
    fprintf(out, "],\n \"tasks\": [");
    for (size_t i = 0; i < tasks.size(); ++i) {
      fprintf(out, "%s{\"name\": %s, \"active\": %s, \"seconds_ago\": %lld}",
              i ? ", " : "", JsonString(tasks[i].name).c_str(),
              tasks[i].active_ago >= 0 ? "true" : "false", tasks[i].active_ago);
    }
    fprintf(out, "]}\n");
    return daemon ? 0 : 1;
  }
  fprintf(out, "service:  %s, %s\n", running ? "running" : "not running",
          busy ? "busy" : "idle");
  if (several) {
    fprintf(out, "paired:   open to several clients\n");
  } else {
    fprintf(out, "paired:   client %s, server name %s\n",
            OrDash(client).c_str(), OrDash(server_name).c_str());
  }
  if (daemon && port == 0) {
    fprintf(out, "daemon:   pid %ld (started by its unit)\n",
            static_cast<long>(pid));
  } else if (daemon) {
    fprintf(out, "daemon:   pid %ld, port %d\n", static_cast<long>(pid), port);
  } else {
    fprintf(out, "daemon:   not running\n");
  }
  for (const ShareRow& s : shares) {
    fprintf(out, "share %-16s running %s, last completed by %s\n",
            s.name.c_str(), OrDash(s.running).c_str(),
            OrDash(s.complete).c_str());
  }
  for (const TaskRow& t : tasks) {
    fprintf(out, "task  %-16s %s\n", t.name.c_str(), t.status.c_str());
  }
  return daemon ? 0 : 1;
}

int PrintPairings(FILE* out, bool json) {
  List sections(KLIBCSzListAlloc());
  int count = sections
                  ? KLIBCFileEnumSection(RegistryPath().c_str(), sections.get())
                  : -1;
  if (count < 0) return -1;
  if (json) fprintf(out, "{");
  for (int i = 0; i < count; ++i) {
    const char* section = KLIBCSzListGet(sections.get(), i);
    Hash h(KLIBCSzHashAlloc(256));
    if (!h || S2SGetServerInfo(section, h.get()) < 0) return -1;
    if (json) {
      fprintf(out, "%s%s: {", i ? ",\n " : "", JsonString(section).c_str());
    } else {
      fprintf(out, "[%s]\n", section);
    }
    for (int k = 0; k < KLIBCSzHashCount(h.get()); ++k) {
      std::string key = KLIBCSzHashKeyAt(h.get(), k);
      std::string value = KLIBCSzHashValueAt(h.get(), k);
      // The many-client marker is a mode, not a client.
      if (!json && value == S2S_MULTI_SRC_MARKER) {
        value = "(open to several clients)";
      }
      if (json) {
        fprintf(out, "%s%s: %s", k ? ", " : "", JsonString(key).c_str(),
                JsonString(value).c_str());
      } else {
        fprintf(out, "\t%s=\"%s\"\n", key.c_str(), value.c_str());
      }
    }
    if (json) fprintf(out, "}");
  }
  if (json) fprintf(out, "}\n");
  return 0;
}

}  // namespace s2s_tools
