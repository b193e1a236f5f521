// SyncInfo, TaskInfo and SyncTask: what a client pushes to which server.
//
// SyncInfo holds the connection settings of the server (address, account,
// transfer options); TaskInfo adds the task's name, its list of local shares
// and its Schedule; SyncTask adds the task's numeric id. All three are plain
// copyable values that own everything they hold; the password is kept in
// clear in memory and never printed. Validate() tells whether a task is
// complete; it logs the first broken rule at NOTE and changes nothing.
// Thread-safety: none, like any value type.
#ifndef S2S_SYNC_OBJ_TASK_H_
#define S2S_SYNC_OBJ_TASK_H_

#include <stdint.h>

#include <list>
#include <string>

#include "S2S/export.h"
#include "S2S/sync_obj_schedule.h"

namespace S2S {

// State and outcome of a task as the service records them; this library
// only passes the numbers on.
enum TASK_STATUS : int32_t {};
enum TASK_RESULT : int32_t {};

class S2S_EXPORT SyncInfo {
 public:
  // Bits of the sync config flag; other bits are kept as given.
  static constexpr unsigned int kCompression = 1u << 0;
  static constexpr unsigned int kSSH = 1u << 1;
  static constexpr unsigned int kBlockLevelSync = 1u << 2;

  // Every number 0, every string empty.
  SyncInfo();

  std::string GetUser() const { return user_; }
  std::string GetPassword() const { return password_; }
  std::string GetServerIP() const { return server_ip_; }
  std::string GetServerName() const { return server_name_; }
  bool UseCompression() const { return (flag_ & kCompression) != 0; }
  bool UseSSH() const { return (flag_ & kSSH) != 0; }
  bool UseBlockLevelSync() const { return (flag_ & kBlockLevelSync) != 0; }
  // Bandwidth limit handed on to the transfer; 0 means none.
  unsigned int GetMaxBandwidth() const { return max_bandwidth_; }
  // 0 means unset.
  unsigned int GetSSHPort() const { return ssh_port_; }
  unsigned int GetSyncConfigFlag() const { return flag_; }

  void SetUser(const std::string& user) { user_ = user; }
  void SetPassword(const std::string& password) { password_ = password; }
  void SetServerIP(const std::string& ip) { server_ip_ = ip; }
  void SetServerName(const std::string& name) { server_name_ = name; }
  void SetMaxBandwidth(unsigned int bandwidth) { max_bandwidth_ = bandwidth; }
  void SetSSHPort(unsigned int port) { ssh_port_ = port; }
  // Replaces the whole flag word.
  void SetSyncConfigFlag(unsigned int flag) { flag_ = flag; }
  // Each sets or clears its own bit only.
  void SetCompression(bool on) { SetBit(kCompression, on); }
  void SetSSH(bool on) { SetBit(kSSH, on); }
  void SetBlockLevelSync(bool on) { SetBit(kBlockLevelSync, on); }

  // True when a server address or name, a user and a possible SSH port are
  // given; otherwise logs why at NOTE and returns false.
  bool Validate() const;

 private:
  void SetBit(unsigned int bit, bool on) {
    flag_ = on ? (flag_ | bit) : (flag_ & ~bit);
  }

  unsigned int flag_;
  unsigned int ssh_port_;
  unsigned int max_bandwidth_;
  std::string user_;
  std::string password_;
  std::string server_ip_;
  std::string server_name_;
};

class S2S_EXPORT TaskInfo {
 public:
  TaskInfo();

  std::string GetName() const { return name_; }
  // Share names in the user's order.
  const std::list<std::string>& GetShareList() const { return shares_; }
  const SyncInfo& GetSyncInfo() const { return sync_info_; }
  const Schedule& GetSchedule() const { return schedule_; }
  // For editing the schedule in place.
  Schedule& GetSchedule() { return schedule_; }

  void SetName(const std::string& name) { name_ = name; }
  void SetShareList(const std::list<std::string>& shares) { shares_ = shares; }
  void SetSyncInfo(const SyncInfo& info) { sync_info_ = info; }
  void SetSchedule(const Schedule& schedule) { schedule_ = schedule; }

  // True when the sync info and the schedule validate, the name and the
  // share list are not empty and the host accepts every share for syncing.
  // Otherwise logs the first failure at NOTE and returns false.
  bool Validate() const;

 private:
  std::string name_;
  std::list<std::string> shares_;
  SyncInfo sync_info_;
  Schedule schedule_;
};

class S2S_EXPORT SyncTask {
 public:
  SyncTask();

  unsigned long long GetID() const { return id_; }
  void SetID(unsigned long long id) { id_ = id; }
  const TaskInfo& GetInfo() const { return info_; }
  TaskInfo& GetInfo() { return info_; }
  // Copies every field of `info`.
  void SetInfo(const TaskInfo& info) { info_ = info; }

 private:
  unsigned long long id_;
  TaskInfo info_;
};

// Field-by-field equality, the password included, so that an object rebuilt
// from a map or a message can be compared with its source.
S2S_EXPORT bool operator==(const SyncInfo& a, const SyncInfo& b);
S2S_EXPORT bool operator==(const TaskInfo& a, const TaskInfo& b);
S2S_EXPORT bool operator==(const SyncTask& a, const SyncTask& b);
inline bool operator!=(const SyncInfo& a, const SyncInfo& b) {
  return !(a == b);
}
inline bool operator!=(const TaskInfo& a, const TaskInfo& b) {
  return !(a == b);
}
inline bool operator!=(const SyncTask& a, const SyncTask& b) {
  return !(a == b);
}

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_TASK_H_
