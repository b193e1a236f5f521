// One share's sync run against the server: announcing it, pushing its data
// and its key file, beacons while it lasts, and its end.
#include <memory>
#include <string>

#include "S2S/rsyncer.h"
#include "S2S/s2s_host.h"
#include "karo_err.h"
#include "karo_section.h"
#include "karo_share.h"

#define S2S_LOG_AREA "rsyncer"
#include "S2S/log.h"

namespace S2S {

namespace {

// The server did not take the share attributes of a sync start: an older
// server that knows only the plain form.
const int kAttributesRefused = 202;
// SyncEncryptKey's answer when the platform cannot describe the share.
const int kPlatformFailure = 300;
// The server's key-file directory; the wrapper maps it onto the daemon's
// key module.
const char kKeyDirectory[] = "/usr/karo/etc/.encrypt";

struct ShareFree {
  void operator()(KARO_SHARE* share) const { KAROShareFree(share); }
};

}  // namespace

int Rsyncer::GetShareInfo(const std::string& shareName, ShareInfo& info) {
  auto it = shareInfoCache_.find(shareName);
  if (it != shareInfoCache_.end()) {
    info = it->second;
    return 0;
  }
  if (S2S::GetShareInfo(shareName, info) != 0) return -1;
  shareInfoCache_.emplace(shareName, info);
  return 0;
}

int Rsyncer::StartSyncShare(const std::string& shareName, int& status) {
  if (StartSyncShare(shareName, true, status) != 0) {
    LOG_ERROR("Fail to start sync share '%s' with ACL", shareName.c_str());
    return -1;
  }
  if (status == kAttributesRefused &&
      StartSyncShare(shareName, false, status) != 0) {
    LOG_ERROR("Fail to start sync share '%s'", shareName.c_str());
    return -1;
  }
  return 0;
}

int Rsyncer::StartSyncShare(const std::string& shareName,
                            bool withShareAttributes, int& status) {
  RsyncTask task;
  std::list<std::string> request;
  if (GenStartSyncShareCmd(shareName, withShareAttributes, request) != 0) {
    LOG_ERROR("StartSyncShare: Fail to write command file");
    return -1;
  }
  InitRsyncTask(task, false);
  status = task.ExecuteCmd(request, cancel_);
  return 0;
}

int Rsyncer::RunSync(unsigned long long /*taskId*/,
                     const std::string& shareName,
                     const std::string& relativePath,
                     const std::list<std::string>& excludes, int& status) {
  ShareInfo info;
  if (GetShareInfo(shareName, info) != 0) {
    LOG_ERROR("Fail to get share info of '%s'", shareName.c_str());
    return -1;
  }
  RsyncTask task;
  InitRsyncTask(task, false);
  task.SetCompression(syncInfo_.UseCompression());
  task.SetBlockLevelSync(syncInfo_.UseBlockLevelSync());
  task.SetSyncACL(true);
  // The task's limit, in KiB/s, as rsync takes it.
  task.setBandwidthLimit(syncInfo_.GetMaxBandwidth());
  std::string source;
  if (relativePath == "/") {
    source = info.GetModulePath() + "/";
  } else {
    // rsync recreates what follows the "/./" marker below the module.
    source = info.GetModulePath() + "/." + relativePath;
    task.SetRelativePath(true);
  }
  // A path that vanished since the change was seen has nothing to send.
  if (!IsPathExist(source)) {
    status = 0;
    return 0;
  }
  status = task.Execute(source, info.GetModuleName(), cancel_, "", excludes);
  return 0;
}

int Rsyncer::SyncEncryptKey(const std::string& shareName) const {
  KARO_SHARE* raw = nullptr;
  if (KAROShareGet(shareName.c_str(), &raw) != 0) {
    LOG_ERROR("Fail to get share '%s', errno=[%d]", shareName.c_str(),
              KLIBCErrGet());
    return kPlatformFailure;
  }
  std::unique_ptr<KARO_SHARE, ShareFree> share(raw);
  int encrypted = 0;
  if (KLIBShareIsEncryptionGet(share.get(), &encrypted) != 0) {
    LOG_ERROR("Fail to get status of encryption of share '%s', errno=[%d]",
              shareName.c_str(), KLIBCErrGet());
    return kPlatformFailure;
  }
  if (!encrypted) return 0;
  int autoDecrypt = 0;
  if (KLIBShareIsAutoDecryptGet(share.get(), &autoDecrypt) != 0) {
    LOG_ERROR("Fail to get status of encryption of share '%s', errno=[%d]",
              shareName.c_str(), KLIBCErrGet());
    return kPlatformFailure;
  }
  char keyFile[4096] = {0};
  if (autoDecrypt) {
    if (KAROShareEncAutoKeyFileGet(share.get(), keyFile, sizeof keyFile) < 0) {
      LOG_ERROR(
          "SyncEncryptKey: Fail to get auto key file path for share '%s', "
          "errno=[%d]",
          shareName.c_str(), KLIBCErrGet());
      return kPlatformFailure;
    }
  } else if (KAROShareEncKeyFileGet(share.get(), keyFile, sizeof keyFile) < 0) {
    LOG_ERROR(
        "SyncEncryptKey: Fail to get key file path for share '%s', "
        "errno=[%d]",
        shareName.c_str(), KLIBCErrGet());
    return kPlatformFailure;
  }
  if (!KLIBCFileExist(keyFile)) return 0;

  RsyncTask task;
  InitRsyncTask(task, false);
  task.SetCompression(syncInfo_.UseCompression());
  task.SetBlockLevelSync(syncInfo_.UseBlockLevelSync());
  // Key files never travel over the plain daemon socket, whatever the sync
  // itself uses.
  task.SetSSH(true);
  task.SetServerPort(syncInfo_.GetSSHPort());
  return task.Execute(keyFile, kKeyDirectory, cancel_, shareName, {});
}

int Rsyncer::SendBeacon(const std::string& taskName, int& status) const {
  RsyncTask task;
  std::list<std::string> request;
  if (GenSendBeaconCmd(taskName, request) != 0) {
    LOG_ERROR("SendBeacon: Fail to write command file");
    return -1;
  }
  InitRsyncTask(task, false);
  status = task.ExecuteCmd(request, cancel_);
  return 0;
}

int Rsyncer::FinishSync(const std::string& finishType, const std::string& name,
                        int& status) const {
  RsyncTask task;
  std::list<std::string> request;
  if (GenFinishSyncCmd(finishType, name, request) != 0) {
    LOG_ERROR("FinishSync: Fail to write command file");
    return -1;
  }
  InitRsyncTask(task, false);
  status = task.ExecuteCmd(request, cancel_);
  return 0;
}

}  // namespace S2S
