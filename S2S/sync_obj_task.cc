#include "S2S/sync_obj_task.h"

#include "S2S/s2s_share.h"

#define S2S_LOG_AREA "sync_obj"
#include "S2S/log.h"

namespace S2S {

namespace {

const unsigned int kMaxPort = 65535;

}  // namespace

SyncInfo::SyncInfo() : flag_(0), ssh_port_(0), max_bandwidth_(0) {}

bool SyncInfo::Validate() const {
  if (server_ip_.empty() && server_name_.empty()) {
    LOG_NOTE("Empty server ip and name");
    return false;
  }
  if (user_.empty()) {
    LOG_NOTE("Empty user name '%s'", user_.c_str());
    return false;
  }
  if (ssh_port_ > kMaxPort) {
    LOG_NOTE("Invalid SSH port '%u'", ssh_port_);
    return false;
  }
  return true;
}

TaskInfo::TaskInfo() {}

bool TaskInfo::Validate() const {
  if (!sync_info_.Validate()) return false;
  if (!schedule_.Validate()) return false;
  if (name_.empty()) {
    LOG_NOTE_NONL("Empty task name");
    return false;
  }
  if (shares_.empty()) {
    LOG_NOTE_NONL("Empty share list");
    return false;
  }
  for (const std::string& share : shares_) {
    bool ok = false;
    if (IsValidShare(share, ok) < 0 || !ok) {
      LOG_NOTE("Share '%s' is not valid", share.c_str());
      return false;
    }
  }
  return true;
}

SyncTask::SyncTask() : id_(0) {}

bool operator==(const SyncInfo& a, const SyncInfo& b) {
  return a.GetSyncConfigFlag() == b.GetSyncConfigFlag() &&
         a.GetSSHPort() == b.GetSSHPort() &&
         a.GetMaxBandwidth() == b.GetMaxBandwidth() &&
         a.GetUser() == b.GetUser() && a.GetPassword() == b.GetPassword() &&
         a.GetServerIP() == b.GetServerIP() &&
         a.GetServerName() == b.GetServerName();
}

bool operator==(const TaskInfo& a, const TaskInfo& b) {
  return a.GetName() == b.GetName() && a.GetShareList() == b.GetShareList() &&
         a.GetSyncInfo() == b.GetSyncInfo() &&
         a.GetSchedule() == b.GetSchedule();
}

bool operator==(const SyncTask& a, const SyncTask& b) {
  return a.GetID() == b.GetID() && a.GetInfo() == b.GetInfo();
}

}  // namespace S2S
