// The command files the client hands to the server's daemon: one writer for
// the common frame and one builder per server command.
#include <string>
#include <utility>

#include "S2S/rsyncer.h"
#include "S2S/s2s_host.h"

#define S2S_LOG_AREA "rsyncer"
#include "S2S/log.h"

namespace S2S {

namespace {

using Params = std::list<std::pair<std::string, std::string>>;

// The server's own name for this appliance is cut to what its registry
// keeps.
const unsigned int kServerNameLength = 35;

// Pairing requests spell flags as words, the sync start as digits; the
// server reads each form only where it expects it.
const char* YesNo(bool on) { return on ? "yes" : "no"; }
const char* OneZero(bool on) { return on ? "1" : "0"; }

std::string Line(const std::string& key, const std::string& value) {
  return key + "=\"" + value + "\"";
}

}  // namespace

int Rsyncer::WriteCommand(const std::string& command, const Params& params,
                          std::list<std::string>& out) const {
  std::string clientId = GetClientID();
  if (clientId.empty()) {
    LOG_ERROR("Fail to get client id");
    return -1;
  }
  out.push_back(Line("command", command));
  out.push_back(Line("clientID", clientId));
  for (const auto& p : params) out.push_back(Line(p.first, p.second));
  return 0;
}

int Rsyncer::GenSinglePairCmd(bool dryRun, std::list<std::string>& out) const {
  Params params = {{"dryRun", YesNo(dryRun)},
                   {"serverName", GetHostName(kServerNameLength)}};
  return WriteCommand("S2S_Pairing", params, out);
}

int Rsyncer::GenServerVersionCmd(const std::string& outfile,
                                 std::list<std::string>& out) const {
  return WriteCommand("S2S_GetProtocolVer", {{"outfile", outfile}}, out);
}

int Rsyncer::GenSendBeaconCmd(const std::string& taskName,
                              std::list<std::string>& out) const {
  if (taskName.empty()) {
    LOG_ERROR("GenSendBeaconCmd: Empty parameter");
    return -1;
  }
  return WriteCommand("S2S_UpdateTaskStatus", {{"taskName", taskName}}, out);
}

int Rsyncer::GenFinishSyncCmd(const std::string& finishType,
                              const std::string& name,
                              std::list<std::string>& out) const {
  if (finishType.empty() || name.empty()) {
    LOG_ERROR("GenFinishSyncCmd: Empty parameter");
    return -1;
  }
  return WriteCommand("S2S_SyncFinish",
                      {{"finishType", finishType}, {"name", name}}, out);
}

int Rsyncer::GenStartSyncShareCmd(const std::string& shareName,
                                  bool withShareAttributes,
                                  std::list<std::string>& out) {
  if (shareName.empty()) {
    LOG_ERROR("GenStartSyncShareCmd: Empty parameter");
    return -1;
  }
  ShareInfo share;
  if (GetShareInfo(shareName, share) != 0) {
    LOG_ERROR("Fail to get share info of '%s'", shareName.c_str());
    return -1;
  }
  VolumeInfo volume;
  if (S2S::GetVolumeInfo(shareName, volume) != 0) {
    LOG_ERROR("Fail to get volume info");
    return -1;
  }
  // A volume without a path has no name to give.
  if (volume.GetPath().empty()) {
    LOG_ERROR("Fail to get volume info");
    return -1;
  }
  Params params = {{"volumeName", volume.GetName()},
                   {"shareName", share.GetName()}};
  if (withShareAttributes) {
    params.emplace_back("isEncrypt", OneZero(share.IsEncrypted()));
    params.emplace_back("isAutomount", OneZero(share.IsAutoMount()));
    params.emplace_back("isEnableACL", OneZero(share.IsACL()));
    params.emplace_back("isWinShare", OneZero(share.IsWinShare()));
    params.emplace_back(
        "lenEncKey",
        std::to_string(static_cast<int>(share.GetEncryptKeyLen())));
  }
  return WriteCommand("S2S_SyncStart", params, out);
}

int Rsyncer::GenPairMultiSrcCmd(bool dryRun, bool requireEncryptionShareSupport,
                                const std::list<std::string>& shares,
                                const std::string& outfile,
                                std::list<std::string>& out) const {
  if (shares.empty()) {
    LOG_ERROR("GenPairMultiSrcCmd: Empty parameter");
    return -1;
  }
  std::string joined;
  bool first = true;
  for (const std::string& share : shares) {
    if (!first) joined += ":";
    joined += share;
    first = false;
  }
  Params params = {
      {"serverName", GetHostName(kServerNameLength)},
      {"syncShares", joined},
      {"dryRun", YesNo(dryRun)},
      {"outfile", outfile},
      {"requireEncryptionShareSupport", YesNo(requireEncryptionShareSupport)}};
  return WriteCommand("S2S_PairingMultiSrc", params, out);
}

int Rsyncer::SplitStringByChars(const std::string& text,
                                const std::string& separators,
                                std::list<std::string>& out) {
  std::string::size_type start = 0;
  for (;;) {
    std::string::size_type pos = text.find_first_of(separators, start);
    if (pos == std::string::npos) {
      out.push_back(text.substr(start));
      return 0;
    }
    out.push_back(text.substr(start, pos - start));
    start = pos + 1;
  }
}

}  // namespace S2S
