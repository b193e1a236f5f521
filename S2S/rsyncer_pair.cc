// Pairing this client with the server: one request for the whole client
// (old servers) or one naming the shares (multi-source servers).
#include <stdio.h>

#include <string>

#include "S2S/rsyncer.h"
#include "S2S/s2s_host.h"

#define S2S_LOG_AREA "rsyncer"
#include "S2S/log.h"

namespace S2S {

namespace {

// The server's answer that some shares are fed by another client; the
// answer file then lists them.
const int kConflicts = 214;

// The first line of `path` without its line feed; false when the file cannot
// be opened.
bool ReadFirstLine(const std::string& path, std::string& line) {
  FILE* file = fopen(path.c_str(), "re");
  if (file == nullptr) return false;
  line.clear();
  int c;
  while ((c = fgetc(file)) != EOF && c != '\n') line += static_cast<char>(c);
  fclose(file);
  return true;
}

}  // namespace

int Rsyncer::DoPairing(bool dryRun, const std::list<std::string>& shares,
                       std::list<std::string>& conflicts, int& status) const {
  if (!SupportMultiSource()) {
    conflicts.clear();
    return DoSinglePairing(dryRun, status);
  }
  bool requireEncryption = false;
  for (const std::string& share : shares) {
    ShareInfo info;
    // The direct lookup: pairing must see the share as it is now.
    if (S2S::GetShareInfo(share, info) != 0) {
      LOG_ERROR("Fail to get share info of '%s'", share.c_str());
      return -1;
    }
    if (info.IsEncrypted()) {
      requireEncryption = true;
      break;
    }
  }
  return DoMultiPairing(dryRun, requireEncryption, shares, conflicts, status);
}

int Rsyncer::DoSinglePairing(bool dryRun, int& status) const {
  RsyncTask task;
  std::list<std::string> request;
  if (GenSinglePairCmd(dryRun, request) != 0) {
    LOG_ERROR("SinglePairing: Fail to write command file");
    return -1;
  }
  InitRsyncTask(task, dryRun);
  status = task.ExecuteCmd(request, cancel_);
  return 0;
}

int Rsyncer::DoMultiPairing(bool dryRun, bool requireEncryptionShareSupport,
                            const std::list<std::string>& shares,
                            std::list<std::string>& conflicts,
                            int& status) const {
  if (shares.empty()) {
    LOG_ERROR("MultiPairing: Share list is empty");
    return -1;
  }
  std::string path = GetTempFile();
  if (path.empty()) {
    LOG_ERROR("MultiPairing: Fail to get output file");
    return -1;
  }
  int rc = -1;
  RsyncTask task;
  std::list<std::string> request;
  std::string line;
  if (GenPairMultiSrcCmd(dryRun, requireEncryptionShareSupport, shares, path,
                         request) != 0) {
    LOG_ERROR("MultiPairing: Fail to write command file");
  } else {
    InitRsyncTask(task, dryRun);
    status = task.ExecuteCmd(request, cancel_);
    if (status != 0 && status != kConflicts) {
      LOG_ERROR("Fail to check share pairing [%d]", status);
    } else if (!ReadFirstLine(path, line)) {
      LOG_ERROR("Fail to open conflict share file");
      LOG_ERROR("Fail to parse out conflict shares");
    } else {
      if (!line.empty()) SplitStringByChars(line, ":", conflicts);
      rc = 0;
    }
  }
  PutTempFile(path);
  return rc;
}

}  // namespace S2S
