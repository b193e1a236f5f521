// s2sctl: the front end of the client service s2sd.
//
//   s2sctl [--root DIR] [--socket PATH] [--json] COMMAND ...   (see --help)
//
// Each command is one request on the daemon's control socket
// (doc/service_protocol.md). Tables for people on standard output, or the
// reply as JSON with --json; errors in words on standard error; the exit
// code says what failed (ctl_options.h).
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <string>

#include "S2S/logger.h"
#include "control_client.h"
#include "ctl_options.h"
#include "ctl_print.h"
#include "ctl_task.h"
#include "json_writer.h"
#include "karo_root.h"
#include "task_file.h"

namespace {

using namespace s2s_tools;

int ExitFor(unsigned long long result) {
  switch (result) {
    case s2s_service::kResultOk:
      return kCtlOk;
    case s2s_service::kResultMalformed:
      return kCtlUsage;
    case s2s_service::kResultUnknownTask:
      return kCtlUnknownTask;
    case s2s_service::kResultInvalidTask:
      return kCtlInvalidTask;
    case s2s_service::kResultBusy:
      return kCtlBusy;
    case s2s_service::kResultNotPermitted:
      return kCtlNotPermitted;
    default:
      return kCtlFailed;
  }
}

int ExitFor(ControlClient::Status status) {
  switch (status) {
    case ControlClient::kUnreachable:
      return kCtlUnreachable;
    case ControlClient::kRefused:
      return kCtlNotPermitted;
    case ControlClient::kUnsendable:
      return kCtlUsage;
    default:
      return kCtlFailed;
  }
}

// One request; on failure prints why and sets `code`.
bool Call(const ControlClient& client, const S2S::PObject& request,
          S2S::PObject& reply, int& code) {
  std::string error;
  ControlClient::Status status = client.Call(request, reply, error);
  if (status != ControlClient::kReplied) {
    fprintf(stderr, "s2sctl: %s\n", error.c_str());
    code = ExitFor(status);
    return false;
  }
  return true;
}

// The id of TASK: digits are an id; anything else is looked up by name in
// the daemon's list.
bool ResolveTask(const ControlClient& client, const std::string& target,
                 unsigned long long& id, int& code) {
  if (ParseNumber(target, ~0ULL, id)) return true;
  S2S::PObject request, reply;
  request["action"] = "list";
  if (!Call(client, request, reply, code)) return false;
  if (reply["result"].asUInt64() != s2s_service::kResultOk) {
    fprintf(stderr, "s2sctl: %s\n", reply["message"].asString().c_str());
    code = ExitFor(reply["result"].asUInt64());
    return false;
  }
  for (const S2S::PObject& task : reply["tasks"].asArray()) {
    if (task["name"].isString() && task["name"].asString() == target) {
      id = task["id"].asUInt64();
      return true;
    }
  }
  fprintf(stderr, "s2sctl: no task named '%s'\n", target.c_str());
  code = kCtlUnknownTask;
  return false;
}

// The request for the command; false with `code` when it cannot be built.
bool BuildRequest(const CtlOptions& o, unsigned long long id,
                  S2S::PObject& request, int& code) {
  static const struct {
    const char* command;
    const char* action;
  } kActions[] = {
      {"task list", "list"},       {"task show", "get"},
      {"task add", "add"},         {"task edit", "update"},
      {"task delete", "delete"},   {"task enable", "enable"},
      {"task disable", "disable"}, {"run", "run"},
      {"cancel", "cancel"},        {"status", "status"},
      {"history", "history"},      {"reload", "reload"},
  };
  for (const auto& a : kActions) {
    if (o.command == a.command) request["action"] = a.action;
  }
  if (!o.target.empty()) request["id"] = id;
  if (o.command == "history" && o.limit != 0) request["limit"] = o.limit;
  if (o.dry_run) request["dry_run"] = true;
  if (o.confirm_deletions) request["confirm_deletions"] = true;
  if (o.command == "task add" || o.command == "task edit") {
    std::string note, error;
    if (!BuildTaskMap(o, o.command == "task add", request["task"], note,
                      error)) {
      fprintf(stderr, "s2sctl: %s\n", error.c_str());
      code = kCtlUsage;
      return false;
    }
    if (!note.empty()) fprintf(stderr, "s2sctl: note: %s\n", note.c_str());
  }
  return true;
}

// Waits until the dry run that `run` started has ended, then shows it (the
// task's newest run) and returns the exit code.
int AwaitDryRun(const CtlOptions& o, const ControlClient& client,
                unsigned long long id) {
  S2S::PObject get, reply;
  get["action"] = "get";
  get["id"] = id;
  int code = kCtlOk;
  for (;;) {
    if (!Call(client, get, reply, code)) return code;
    if (reply["result"].asUInt64() != s2s_service::kResultOk) {
      fprintf(stderr, "s2sctl: %s\n", reply["message"].asString().c_str());
      return ExitFor(reply["result"].asUInt64());
    }
    const std::string state = reply["task"]["state"].asString();
    if (state != "running" && state != "queued") break;
    timespec pause = {0, 200 * 1000 * 1000};
    nanosleep(&pause, nullptr);
  }
  S2S::PObject history;
  history["action"] = "history";
  history["id"] = id;
  history["limit"] = 1ULL;
  if (!Call(client, history, reply, code)) return code;
  const S2S::PObject& answer = reply;  // const: an array is read by index
  const S2S::PObject& run = answer["runs"][0u];
  if (!run["dry_run"].asBool()) {
    fprintf(stderr, "s2sctl: the dry run left no record\n");
    return kCtlFailed;
  }
  if (o.json) {
    printf("%s\n", ToJson(run, true).c_str());
  } else {
    fputs(FormatDryRun(run).c_str(), stdout);
  }
  if (run["outcome"].asString() == "ok") return kCtlOk;
  fprintf(stderr, "s2sctl: %s\n", run["message"].asString().c_str());
  return kCtlDryRunFailed;
}

void PrintHuman(const CtlOptions& o, const S2S::PObject& reply) {
  std::string text;
  if (o.command == "task list") {
    text = FormatTaskList(reply);
  } else if (o.command == "task show") {
    text = FormatTask(reply);
  } else if (o.command == "status") {
    text = FormatStatus(reply);
  } else if (o.command == "history") {
    text = FormatHistory(reply);
  } else {
    text = reply["message"].asString() + "\n";
    if (o.command == "task add") {
      text += "id " + std::to_string(reply["id"].asUInt64()) + "\n";
    }
    for (const S2S::PObject& e : reply["errors"].asArray()) {
      text += "  " + e.asString() + "\n";
    }
  }
  fputs(text.c_str(), stdout);
}

}  // namespace

int main(int argc, char** argv) {
  CtlOptions o;
  std::string error;
  if (!ParseCtlArgs(argc, argv, o, error)) {
    fprintf(stderr, "s2sctl: %s\n(try --help)\n", error.c_str());
    return kCtlUsage;
  }
  if (o.help) {
    fputs(CtlUsage(), stdout);
    return kCtlOk;
  }
  if (o.version) {
    printf("s2sctl %s\n", S2S_VERSION);
    return kCtlOk;
  }
  if (!o.root.empty()) setenv(KARO_ROOT_ENV, o.root.c_str(), 1);
  // The library's own messages only when asked for: what went wrong reaches
  // the person as one line of s2sctl's.
  S2S::Logger::Initialize(
      S2S::Logger::Stderr,
      o.verbose > 0 ? S2S::Logger::Debug : S2S::Logger::Error - 1, "", 0);
  ControlClient client(o.socket);
  int code = kCtlOk;
  unsigned long long id = 0;
  if (!o.target.empty() && !ResolveTask(client, o.target, id, code)) {
    return code;
  }
  S2S::PObject request, reply;
  if (!BuildRequest(o, id, request, code)) return code;
  if (!Call(client, request, reply, code)) return code;
  const unsigned long long result = reply["result"].asUInt64();
  if (o.dry_run && result == s2s_service::kResultOk) {
    return AwaitDryRun(o, client, id);
  }
  if (o.json) {
    printf("%s\n", ToJson(reply, true).c_str());
  } else if (result == s2s_service::kResultOk) {
    PrintHuman(o, reply);
  }
  if (result != s2s_service::kResultOk) {
    fprintf(stderr, "s2sctl: %s\n", reply["message"].asString().c_str());
  }
  return ExitFor(result);
}
