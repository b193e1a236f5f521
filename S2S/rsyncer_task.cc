// One rsync invocation of the client (RsyncTask) and the Rsyncer's
// connection settings that every invocation starts from.
#include <string>

#include "S2S/rsyncer.h"

#define S2S_LOG_AREA "rsyncer"
#include "S2S/log.h"

namespace S2S {

namespace {

// A command gets an answer within a minute; data may stall longer on a
// busy server before rsync's own I/O time-out gives up.
const unsigned int kCommandTimeout = 60;
const unsigned int kDataTimeout = 600;

// A null checker becomes an empty function: the wrapper then never polls.
boost::function<bool()> CancelFunction(bool (*cancel)()) {
  boost::function<bool()> f;
  if (cancel != nullptr) f = cancel;
  return f;
}

}  // namespace

Rsyncer::RsyncTask::RsyncTask() {
  setDelete(true);
  setNumericIds(true);
  setKaroAuth(true, true);
  setKaroPseudoRoot(true);
}

Rsyncer::RsyncTask::~RsyncTask() {
  // Like the wrapper's copy, the password should not linger in freed memory.
  for (char& c : password_) *static_cast<volatile char*>(&c) = 0;
}

void Rsyncer::RsyncTask::SetUser(const std::string& user) { user_ = user; }
void Rsyncer::RsyncTask::SetServerIP(const std::string& ip) { serverIP_ = ip; }
void Rsyncer::RsyncTask::SetPassword(const std::string& password) {
  password_ = password;
}

void Rsyncer::RsyncTask::SetSSH(bool on) { setSsh(on); }
void Rsyncer::RsyncTask::SetServerPort(unsigned int port) { setPort(port); }
void Rsyncer::RsyncTask::SetCompression(bool on) { setCompress(on); }
void Rsyncer::RsyncTask::SetBlockLevelSync(bool on) { setDeltaCopy(on); }
void Rsyncer::RsyncTask::SetListOnly(bool on) { setListOnly(on); }
void Rsyncer::RsyncTask::SetRelativePath(bool on) { setRelativePath(on); }
void Rsyncer::RsyncTask::SetSyncACL(bool on) { setKaroAcl(on); }
// Probes run often and succeed quietly; real work is logged in full.
void Rsyncer::RsyncTask::SetTestTask(bool on) { setDebugLog(!on); }

int Rsyncer::RsyncTask::ExecuteCmd(const std::list<std::string>& commands,
                                   bool (*cancel)()) {
  setTimeout(kCommandTimeout);
  setKaroCustCmdRule(commands);
  // No module and no path: the command goes to the daemon itself.
  setDestPath(user_, serverIP_, password_, "", "");
  return execute(CancelFunction(cancel));
}

int Rsyncer::RsyncTask::Execute(const std::string& source,
                                const std::string& module, bool (*cancel)(),
                                const std::string& destination,
                                const std::list<std::string>& excludes) {
  setTimeout(kDataTimeout);
  setExcludeRule(excludes);
  setSrcPath(source);
  setDestPath(user_, serverIP_, password_, module, destination);
  return execute(CancelFunction(cancel));
}

Rsyncer::Rsyncer() : serverVersion_(-1), cancel_(nullptr) {}

Rsyncer::~Rsyncer() { Clear(); }

void Rsyncer::Clear() {}

void Rsyncer::SetCancelChecker(bool (*cancel)()) { cancel_ = cancel; }

void Rsyncer::InitRsyncTask(RsyncTask& task, bool testTask) const {
  task.SetServerIP(syncInfo_.GetServerIP());
  task.SetUser(syncInfo_.GetUser());
  task.SetPassword(syncInfo_.GetPassword());
  task.SetSSH(syncInfo_.UseSSH());
  task.SetTestTask(testTask);
  // Without SSH the wrapper's daemon port applies; only SSH has a port of
  // its own in the sync info.
  if (syncInfo_.UseSSH()) task.SetServerPort(syncInfo_.GetSSHPort());
}

}  // namespace S2S
