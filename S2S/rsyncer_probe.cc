// Finding a server address that answers and learning the server's protocol
// version.
#include <stdio.h>

#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "S2S/s2s_address.h"
#include "S2S/s2s_host.h"

#define S2S_LOG_AREA "rsyncer"
#include "S2S/log.h"

namespace S2S {

namespace {

// Statuses of the probe. A failed address lookup has its own number; 213
// stands for "no address was ever tried".
const int kLookupFailed = 42;
const int kNothingTried = 213;
// A dry-run pairing answered by a server that already knows this client.
const int kAlreadyPaired = 207;
// A server without the version command answers with either of these.
const int kUnknownCommand = 43;
const int kUnknownCommandOld = 51;

}  // namespace

int Rsyncer::Initialize(const SyncInfo& info) {
  Clear();
  syncInfo_ = info;
  return TestServer();
}

void Rsyncer::Resume(const SyncInfo& probed, int serverVersion) {
  syncInfo_ = probed;
  serverVersion_ = serverVersion;
}

int Rsyncer::TestServer() {
  int status = kNothingTried;
  std::vector<std::string> candidates;
  if (GetUsableIP(syncInfo_.GetServerName(), syncInfo_.GetServerIP(),
                  candidates) != 0) {
    LOG_ERROR("Fail to lookup ip for %s(%s)", syncInfo_.GetServerName().c_str(),
              syncInfo_.GetServerIP().c_str());
    return kLookupFailed;
  }
  for (const std::string& address : candidates) {
    LOG_INFO("Test %s is reachable", address.c_str());
    syncInfo_.SetServerIP(address);
    if (TestProtocol(status) == 0 && status == 0) {
      GetServerVersion();
      if (serverVersion_ >= 0) {
        LOG_INFO("Get server version [%d]", serverVersion_);
        return 0;
      }
    }
  }
  // A version learnt by an earlier probe of this Rsyncer still counts.
  if (serverVersion_ >= 0) return 0;
  LOG_ERROR("Fail to find rsync reachable ip for %s(%s)",
            syncInfo_.GetServerName().c_str(), syncInfo_.GetServerIP().c_str());
  return status;
}

int Rsyncer::TestProtocol(int& status) const {
  if (DoSinglePairing(true, status) != 0) {
    LOG_ERROR("Fail to test connection");
    return -1;
  }
  if (status == 0) return 0;
  if (status == kAlreadyPaired) {
    status = 0;
    return 0;
  }
  LOG_ERROR("Fail to test connection [%d]", status);
  return 0;
}

int Rsyncer::GetServerVersion() {
  RsyncTask task;
  std::string path = GetTempFile();
  if (path.empty()) {
    LOG_ERROR("GetServerVersion: Fail to get output file");
    return serverVersion_;
  }
  std::list<std::string> request;
  if (GenServerVersionCmd(path, request) != 0) {
    LOG_ERROR("GetServerVersion: Fail to write command file");
    PutTempFile(path);
    return serverVersion_;
  }
  InitRsyncTask(task, true);
  task.SetListOnly(true);
  int status = task.ExecuteCmd(request, cancel_);
  if (status == kUnknownCommand || status == kUnknownCommandOld) {
    serverVersion_ = 0;
  } else if (status == 0) {
    FILE* file = fopen(path.c_str(), "re");
    if (file == nullptr) {
      LOG_ERROR("Fail to open server version file");
      serverVersion_ = -1;
    } else {
      int version = -1;
      if (fscanf(file, "%d", &version) != 1) version = -1;
      fclose(file);
      serverVersion_ = version;
    }
  } else {
    LOG_ERROR("Fail to get server version [%d]", status);
  }
  PutTempFile(path);
  return serverVersion_;
}

bool Rsyncer::SupportMultiSource() const { return serverVersion_ > 0; }

SyncInfo Rsyncer::GetSyncInfo() const { return syncInfo_; }

}  // namespace S2S
