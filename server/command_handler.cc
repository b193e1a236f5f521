#include "command_handler.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <memory>

#include "S2S/is_syncedshare.h"
#include "karo_root.h"
#include "karo_share.h"
#include "protocol.h"

#define S2S_LOG_AREA "server"
#include "S2S/log.h"

namespace S2S {
namespace server {

namespace {

const char kPairSection[] = "PairedClientInfo";
const char kRegistryFile[] = "/usr/karo/etc/karoS2S.info";
const char kInitialisedMarker[] = "/usr/karo/etc/karoS2S.initialised";
// A client id's daemon user: section "CLIENTUSER_<id>", key "user".
const char kClientUserSection[] = "CLIENTUSER_";

struct HashFree {
  void operator()(KSZHASH* h) const { KLIBCSzHashFree(h); }
};
struct ListFree {
  void operator()(KSZLIST* l) const { KLIBCSzListFree(l); }
};
using Hash = std::unique_ptr<KSZHASH, HashFree>;
using List = std::unique_ptr<KSZLIST, ListFree>;

std::string ValueOr(const KSZHASH* h, const char* key) {
  const char* v = KLIBCSzHashGetValue(h, key);
  return v != nullptr ? v : "";
}

// Reads a registry section; nullptr (logged) when the registry is unreadable.
Hash ReadSection(const std::string& section) {
  Hash h(KLIBCSzHashAlloc(1024));
  if (!h || S2SGetServerInfo(section.c_str(), h.get()) < 0) {
    LOG_ERROR("cannot read section [%s] of the registry", section.c_str());
    return nullptr;
  }
  return h;
}

bool IsYesNo(const std::string* v) {
  return v != nullptr && (*v == "yes" || *v == "no");
}

bool ShareExists(const std::string& share) {
  KARO_SHARE* rec = nullptr;
  if (KAROShareGet(share.c_str(), &rec) != 0) return false;
  KAROShareFree(rec);
  return true;
}

// Merges `values` into the share's section and writes it back.
int UpdateShare(
    const std::string& share,
    const std::vector<std::pair<std::string, std::string>>& values) {
  Hash h = ReadSection("SHARE_" + share);
  if (!h) return kRegistryFailure;
  for (const auto& kv : values) {
    if (KLIBCSzHashSetValue(h.get(), kv.first.c_str(), kv.second.c_str()) !=
        0) {
      LOG_ERROR("cannot set %s of share '%s'", kv.first.c_str(), share.c_str());
      return kRegistryFailure;
    }
  }
  if (S2SServerUpdateShare(share.c_str(), h.get()) != 0) {
    LOG_ERROR("cannot write the record of share '%s'", share.c_str());
    return kRegistryFailure;
  }
  return kOk;
}

// The shares of `cmd`'s list that another client feeds, joined with ':'.
int Conflicts(const std::vector<std::string>& shares, const std::string& client,
              std::string* joined) {
  List in(KLIBCSzListAlloc()), free_shares(KLIBCSzListAlloc()),
      own(KLIBCSzListAlloc()), conflicts(KLIBCSzListAlloc());
  if (!in || !free_shares || !own || !conflicts) return kRegistryFailure;
  for (const std::string& s : shares) KLIBCSzListPush(in.get(), s.c_str());
  if (S2SCheckIfSharePaired(in.get(), client.c_str(), free_shares.get(),
                            own.get(), conflicts.get()) != 0) {
    LOG_ERROR("cannot check the pairing of shares for client %s",
              client.c_str());
    return kRegistryFailure;
  }
  joined->clear();
  for (int i = 0; i < KLIBCSzListCount(conflicts.get()); ++i) {
    if (i > 0) *joined += ":";
    *joined += KLIBCSzListGet(conflicts.get(), i);
  }
  return kOk;
}

// Commands other than the version query need the service switched on.
bool ServiceEnabled(int* status) {
  Hash pair = ReadSection(kPairSection);
  if (!pair) {
    *status = kRegistryFailure;
    return false;
  }
  if (ValueOr(pair.get(), "s2sEnabled") == "no") {
    *status = kServiceDisabled;
    return false;
  }
  return true;
}

// The daemon user `client` is bound to, "" when unbound; false when the
// registry cannot be read.
bool BoundUser(const std::string& client, std::string* user) {
  Hash h = ReadSection(kClientUserSection + client);
  if (!h) return false;
  *user = ValueOr(h.get(), "user");
  return true;
}

// Binds an unbound `client` to the peer's daemon user.
int BindClient(const std::string& client, const HandlerContext& ctx) {
  std::string user;
  if (!BoundUser(client, &user)) return kRegistryFailure;
  if (!user.empty() || ctx.peer_user.empty()) return kOk;
  Hash h(KLIBCSzHashAlloc(4));
  std::string section = kClientUserSection + client;
  if (!h || KLIBCSzHashSetValue(h.get(), "user", ctx.peer_user.c_str()) != 0 ||
      S2SUpdateServerInfo(section.c_str(), h.get()) != 0) {
    LOG_ERROR("cannot bind client %s to its daemon user", client.c_str());
    return kRegistryFailure;
  }
  return kOk;
}

int Pairing(const CommandFile& cmd, std::string* answer) {
  const std::string* dry = cmd.Get("dryRun");
  const std::string* name = cmd.Get("serverName");
  if (!IsYesNo(dry) || name == nullptr) return kMalformed;
  if (!IsValidText(*name)) return kBadId;
  int status = kOk;
  if (!ServiceEnabled(&status)) return status;
  Hash pair = ReadSection(kPairSection);
  int old = S2SServerIfOldClientPaired();
  if (!pair || old < 0) return kRegistryFailure;
  std::string paired = ValueOr(pair.get(), "clientID");
  if (old == 1 && paired != cmd.client_id) return kPairedElsewhere;
  if (*dry == "yes") return old == 1 ? kAlreadyPaired : kOk;
  if (KAROUISetS2S(1, cmd.client_id.c_str(), name->c_str()) != 0) {
    return kRegistryFailure;
  }
  answer->clear();
  return kOk;
}

int PairingMultiSrc(const CommandFile& cmd, std::string* answer) {
  const std::string* name = cmd.Get("serverName");
  const std::string* list = cmd.Get("syncShares");
  const std::string* dry = cmd.Get("dryRun");
  if (name == nullptr || list == nullptr || !IsYesNo(dry)) return kMalformed;
  if (!IsValidText(*name)) return kBadId;
  std::vector<std::string> shares;
  size_t start = 0;
  for (;;) {
    size_t colon = list->find(':', start);
    shares.push_back(list->substr(start, colon - start));
    if (colon == std::string::npos) break;
    start = colon + 1;
  }
  for (const std::string& s : shares) {
    if (!IsValidShareName(s)) return kBadId;
  }
  int status = kOk;
  if (!ServiceEnabled(&status)) return status;
  for (const std::string& s : shares) {
    if (!ShareExists(s)) {
      *answer = s + "\n";
      return kUnknownShare;
    }
  }
  int rc = Conflicts(shares, cmd.client_id, answer);
  if (rc != kOk) return rc;
  *answer += "\n";
  if (*answer != "\n") return kConflicts;
  if (*dry == "yes") return kOk;
  if (S2SServerUpdatePairInfo(cmd.client_id.c_str(), name->c_str()) != 0) {
    return kRegistryFailure;
  }
  return kOk;
}

const char* const kAttributes[] = {"isEncrypt", "isAutomount", "isEnableACL",
                                   "isWinShare", "lenEncKey"};

int SyncStart(const CommandFile& cmd, const HandlerContext& ctx) {
  const std::string* volume = cmd.Get("volumeName");
  const std::string* share = cmd.Get("shareName");
  if (volume == nullptr || share == nullptr) return kMalformed;
  if (!IsValidShareName(*share) || !IsValidText(*volume)) return kBadId;
  std::vector<std::pair<std::string, std::string>> values = {
      {"RunningID", cmd.client_id},
      {"RunningHost", ctx.peer_address},
      {"RunningUser", ctx.peer_user},
      {"volumeName", *volume}};
  for (const char* key : kAttributes) {
    const std::string* v = cmd.Get(key);
    if (v == nullptr) continue;
    bool flag = *v == "0" || *v == "1";
    bool number = !v->empty() && v->size() <= 6 &&
                  v->find_first_not_of("0123456789") == std::string::npos;
    if (ctx.old_server || (std::string(key) == "lenEncKey" ? !number : !flag)) {
      return kAttributesRefused;
    }
    values.emplace_back(key, *v);
  }
  int status = kOk;
  if (!ServiceEnabled(&status)) return status;
  // A server bound to one client syncs that client only; a server of the
  // single-client protocol syncs nobody until a client has paired.
  int single = S2SServerIfOldClientPaired();
  if (single < 0) return kRegistryFailure;
  if (single == 1) {
    Hash pair = ReadSection(kPairSection);
    if (!pair) return kRegistryFailure;
    if (ValueOr(pair.get(), "clientID") != cmd.client_id) {
      return kPairedElsewhere;
    }
  } else if (ctx.old_server) {
    return kNotPaired;
  }
  if (!ShareExists(*share)) return kUnknownShare;
  std::string conflicts;
  int rc = Conflicts({*share}, cmd.client_id, &conflicts);
  if (rc != kOk) return rc;
  if (!conflicts.empty()) return kPairedElsewhere;
  return UpdateShare(*share, values);
}

int UpdateTaskStatus(const CommandFile& cmd) {
  const std::string* task = cmd.Get("taskName");
  if (task == nullptr) return kMalformed;
  if (!IsValidTaskName(*task)) return kBadId;
  int status = kOk;
  if (!ServiceEnabled(&status)) return status;
  Hash h(KLIBCSzHashAlloc(16));
  std::string now = std::to_string(static_cast<long long>(time(nullptr)));
  if (!h || KLIBCSzHashSetValue(h.get(), "status", now.c_str()) != 0 ||
      S2SServerUpdateTask(task->c_str(), h.get()) != 0) {
    LOG_ERROR("cannot record the status of task '%s'", task->c_str());
    return kRegistryFailure;
  }
  return kOk;
}

int SyncFinish(const CommandFile& cmd) {
  const std::string* type = cmd.Get("finishType");
  const std::string* name = cmd.Get("name");
  if (type == nullptr || name == nullptr) return kMalformed;
  if (*type != "task" && *type != "share") return kMalformed;
  if (*type == "task" ? !IsValidTaskName(*name) : !IsValidShareName(*name)) {
    return kBadId;
  }
  int status = kOk;
  if (!ServiceEnabled(&status)) return status;
  if (*type == "task") {
    Hash h(KLIBCSzHashAlloc(16));
    if (!h || KLIBCSzHashSetValue(h.get(), "status", "idle") != 0 ||
        S2SServerUpdateTask(name->c_str(), h.get()) != 0) {
      LOG_ERROR("cannot record the end of task '%s'", name->c_str());
      return kRegistryFailure;
    }
    return kOk;
  }
  char running[256] = "";
  S2SServerGetShare(name->c_str(), "RunningID", running, sizeof running);
  if (cmd.client_id != running) return kNotSyncing;
  return UpdateShare(*name, {{"CompleteID", cmd.client_id},
                             {"RunningID", ""},
                             {"RunningHost", ""},
                             {"RunningUser", ""}});
}

// Runs a command other than the version query; the caller holds the
// registry lock.
int RunLocked(const CommandFile& cmd, const HandlerContext& ctx,
              std::string* answer) {
  bool has_registry = access(KaroRootPath(kRegistryFile).c_str(), F_OK) == 0;
  bool marked = access(KaroRootPath(kInitialisedMarker).c_str(), F_OK) == 0;
  if (has_registry && !marked) MarkRegistryInitialised();
  if (!has_registry && marked) {
    LOG_ERROR("the registry %s is gone; refusing commands until it is back",
              KaroRootPath(kRegistryFile).c_str());
    return kRegistryFailure;
  }
  std::string bound;
  if (!BoundUser(cmd.client_id, &bound)) return kRegistryFailure;
  if (!bound.empty() && bound != ctx.peer_user) {
    LOG_WARNING("client %s belongs to another daemon user than %s",
                cmd.client_id.c_str(), ctx.peer_user.c_str());
    return kBadId;
  }
  int status;
  if (cmd.command == "S2S_Pairing") {
    status = Pairing(cmd, answer);
  } else if (cmd.command == "S2S_PairingMultiSrc" && !ctx.old_server) {
    status = PairingMultiSrc(cmd, answer);
  } else if (cmd.command == "S2S_SyncStart") {
    status = SyncStart(cmd, ctx);
  } else if (cmd.command == "S2S_UpdateTaskStatus") {
    status = UpdateTaskStatus(cmd);
  } else if (cmd.command == "S2S_SyncFinish") {
    status = SyncFinish(cmd);
  } else {
    status = kUnknownCommand;
  }
  const std::string* dry = cmd.Get("dryRun");
  bool binds =
      cmd.command == "S2S_SyncStart" ||
      ((cmd.command == "S2S_Pairing" || cmd.command == "S2S_PairingMultiSrc") &&
       dry != nullptr && *dry == "no");
  if (status == kOk && binds) status = BindClient(cmd.client_id, ctx);
  return status;
}

}  // namespace

int HandleCommand(const CommandFile& cmd, const HandlerContext& ctx,
                  std::string* answer) {
  answer->clear();
  if (!IsValidClientId(cmd.client_id)) {
    LOG_WARNING("refused a command with a malformed client id");
    return kBadId;
  }
  if (cmd.command == "S2S_GetProtocolVer" && !ctx.old_server) {
    *answer = std::to_string(kProtocolVersion) + "\n";
    return kOk;
  }
  int wait_ms = -1;
  if (ctx.deadline != 0) {
    time_t left = ctx.deadline - time(nullptr);
    if (left <= 0) {
      LOG_WARNING("%s from client %s not applied: its client has given up",
                  cmd.command.c_str(), cmd.client_id.c_str());
      return kRegistryFailure;
    }
    wait_ms = static_cast<int>(left < 3600 ? left * 1000 : 3600 * 1000);
  }
  int status;
  if (S2SRegistryLock(wait_ms) != 0) {
    LOG_ERROR("%s from client %s not applied: the registry stays locked",
              cmd.command.c_str(), cmd.client_id.c_str());
    status = kRegistryFailure;
  } else {
    status = RunLocked(cmd, ctx, answer);
    S2SRegistryUnlock();
  }
  if (status != kOk) {
    LOG_NOTE("%s from client %s answered with status %d", cmd.command.c_str(),
             cmd.client_id.c_str(), status);
  }
  return status;
}

bool MayPushShare(const std::string& share, const HandlerContext& ctx,
                  std::string* why) {
  if (!IsValidShareName(share)) {
    *why = "not a share module";
    return false;
  }
  if (KAROS2SIsSyncedShare(share.c_str()) != 1) {
    *why = "no sync into this share is running";
    return false;
  }
  char host[256] = "";
  char user[256] = "";
  S2SServerGetShare(share.c_str(), "RunningHost", host, sizeof host);
  S2SServerGetShare(share.c_str(), "RunningUser", user, sizeof user);
  if (ctx.peer_address != host || ctx.peer_user != user) {
    *why = "the running sync of this share belongs to another client";
    return false;
  }
  return true;
}

bool MayDryRunShare(const std::string& share, const HandlerContext& ctx,
                    std::string* why) {
  int status = kOk;
  if (!IsValidShareName(share)) {
    *why = "not a share module";
    return false;
  }
  if (!ServiceEnabled(&status)) {
    *why = status == kServiceDisabled ? "the service is switched off"
                                      : "the registry cannot be read";
    return false;
  }
  Hash record = ReadSection("SHARE_" + share);
  Hash pair = ReadSection(kPairSection);
  if (!record || !pair) {
    *why = "the registry cannot be read";
    return false;
  }
  // Who feeds the share, as a sync start sees it: its running sync, else
  // its last completed one, else the single client of an old pairing.
  std::string feeder = ValueOr(record.get(), "RunningID");
  if (feeder.empty()) feeder = ValueOr(record.get(), "CompleteID");
  if (feeder.empty() && S2SServerIfOldClientPaired() == 1) {
    feeder = ValueOr(pair.get(), "clientID");
  }
  if (feeder.empty()) return true;
  std::string user;
  if (!IsValidClientId(feeder) || !BoundUser(feeder, &user) || user.empty() ||
      user != ctx.peer_user) {
    *why = "the share is fed by another client";
    return false;
  }
  return true;
}

int MarkRegistryInitialised() {
  std::string marker = KaroRootPath(kInitialisedMarker);
  int fd = open(marker.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  if (fd < 0) {
    LOG_ERROR("cannot write %s: %s", marker.c_str(), strerror(errno));
    return -1;
  }
  close(fd);
  return 0;
}

}  // namespace server
}  // namespace S2S
