#include "karo/rsync_wrapper.h"

#include "rsync_args.h"
#include "rsync_child.h"
#include "rsync_command.h"
#include "rsync_log.h"

namespace KARO {
namespace Backup {

namespace {

thread_local RsyncWrapper::ProgressHandler t_progress;
thread_local RsyncWrapper::TransferStats t_stats;
thread_local RsyncWrapper::TransferMode t_mode;

}  // namespace

RsyncWrapper::RsyncWrapper() : settings_(new detail::RsyncSettings) {}

RsyncWrapper::~RsyncWrapper() {
  // The password should not linger in freed memory.
  std::string& pw = settings_->password;
  for (char& c : pw) *static_cast<volatile char*>(&c) = 0;
}

void RsyncWrapper::setDelete(bool on) { settings_->del = on; }
void RsyncWrapper::setNumericIds(bool on) { settings_->numeric_ids = on; }
void RsyncWrapper::setKaroAuth(bool useAuth, bool requireAuth) {
  settings_->use_auth = useAuth;
  settings_->require_auth = requireAuth;
}
void RsyncWrapper::setKaroPseudoRoot(bool on) { settings_->pseudo_root = on; }
void RsyncWrapper::setSsh(bool on) { settings_->ssh = on; }
void RsyncWrapper::setPort(unsigned int port) { settings_->ssh_port = port; }
void RsyncWrapper::setCompress(bool on) { settings_->compress = on; }
void RsyncWrapper::setDeltaCopy(bool on) { settings_->delta_copy = on; }
void RsyncWrapper::setListOnly(bool on) { settings_->list_only = on; }
void RsyncWrapper::setRelativePath(bool on) { settings_->relative = on; }
void RsyncWrapper::setKaroAcl(bool on) { settings_->acl = on; }
void RsyncWrapper::setDebugLog(bool on) { settings_->debug_log = on; }
void RsyncWrapper::setTimeout(unsigned int seconds) {
  settings_->timeout = seconds;
}
void RsyncWrapper::setBandwidthLimit(unsigned int kibPerSecond) {
  settings_->bwlimit = kibPerSecond;
}

bool RsyncWrapper::getDelete() const { return settings_->del; }
bool RsyncWrapper::getNumericIds() const { return settings_->numeric_ids; }
bool RsyncWrapper::getKaroAuthUse() const { return settings_->use_auth; }
bool RsyncWrapper::getKaroAuthRequire() const {
  return settings_->require_auth;
}
bool RsyncWrapper::getKaroPseudoRoot() const { return settings_->pseudo_root; }
bool RsyncWrapper::getSsh() const { return settings_->ssh; }
unsigned int RsyncWrapper::getPort() const { return settings_->ssh_port; }
bool RsyncWrapper::getCompress() const { return settings_->compress; }
bool RsyncWrapper::getDeltaCopy() const { return settings_->delta_copy; }
bool RsyncWrapper::getListOnly() const { return settings_->list_only; }
bool RsyncWrapper::getRelativePath() const { return settings_->relative; }
bool RsyncWrapper::getKaroAcl() const { return settings_->acl; }
bool RsyncWrapper::getDebugLog() const { return settings_->debug_log; }
unsigned int RsyncWrapper::getTimeout() const { return settings_->timeout; }
unsigned int RsyncWrapper::getBandwidthLimit() const {
  return settings_->bwlimit;
}

void RsyncWrapper::setKaroCustCmdRule(const std::list<std::string>& lines) {
  settings_->command_lines = lines;
}

void RsyncWrapper::setDestPath(const std::string& user, const std::string& host,
                               const std::string& password,
                               const std::string& module,
                               const std::string& path) {
  settings_->user = user;
  settings_->host = host;
  settings_->password = password;
  settings_->module = module;
  settings_->path = path;
}

void RsyncWrapper::setExcludeRule(const std::list<std::string>& rules) {
  settings_->excludes = rules;
}

void RsyncWrapper::setSrcPath(const std::string& path) {
  settings_->source = path;
}

int RsyncWrapper::execute(boost::function<bool()> cancel) {
  const detail::RsyncSettings& s = *settings_;
  detail::SetLastError("");
  bool command = !s.command_lines.empty();
  std::string problem = detail::CheckSettings(s, command);
  if (!problem.empty()) {
    detail::Log(LOG_ERR, "cannot run rsync: %s", problem.c_str());
    detail::SetLastError(problem);
    return kBadSettings;
  }
  if (command) return detail::RunCommand(s, cancel);
  std::vector<std::string> args = detail::DataTransferArgs(s, t_mode);
  if (!t_progress && !t_mode.dry_run && t_mode.max_delete < 0) {
    return detail::RunAndLog(args, s, cancel, "transfer");
  }
  // Before "--", the source and the destination, which end the vector.
  args.insert(args.end() - 3, {"--info=progress2", "--stats"});
  detail::ProgressParser parser(t_progress, t_mode.dry_run);
  t_stats = RsyncWrapper::TransferStats();
  int status =
      detail::RunAndLog(args, s, cancel, "transfer", nullptr, 0, &parser);
  t_stats = parser.stats();
  return status;
}

std::string RsyncWrapper::lastError() { return detail::LastError(); }

void RsyncWrapper::setThreadProgressHandler(const ProgressHandler& handler) {
  t_progress = handler;
  t_stats = TransferStats();
}

RsyncWrapper::TransferStats RsyncWrapper::lastStats() { return t_stats; }

void RsyncWrapper::setThreadTransferMode(const TransferMode& mode) {
  t_mode = mode;
}

}  // namespace Backup
}  // namespace KARO
