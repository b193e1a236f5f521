#include "service/daemon.h"

#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <utility>

#include "S2S/logger.h"
#include "karo_process.h"
#include "karo_root.h"
#include "service/exit_codes.h"
#include "service/record.h"

namespace s2s_service {

namespace {

using S2S::PObject;

// With nothing due, the timer is still armed this far ahead, so that a
// change of the clock is noticed all the same.
const long kIdleArm = 365L * 24 * 3600;

void LogError(const std::string& what) {
  S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n", what.c_str());
}

void LogInfo(const std::string& what) {
  S2S::Logger::LogMsg(S2S::Logger::Info, "[INFO] s2sd: %s\n", what.c_str());
}

void Wake(int fd) {
  uint64_t one = 1;
  while (write(fd, &one, sizeof one) < 0 && errno == EINTR) {
  }
}

void Drain(int fd) {
  uint64_t count;
  while (read(fd, &count, sizeof count) < 0 && errno == EINTR) {
  }
}

std::string OutcomeOf(const TaskOutcome& out) {
  if (out.exit_code == kExitOk) return "ok";
  if (out.exit_code == kExitCancelled) return "cancelled";
  if (out.exit_code == kExitDeletions) return "held";
  return "failed";
}

// Paths of a dry run's listing are cut to this many bytes.
const size_t kMaxListedPath = 1024;

// What a dry run would send and delete: the counts and the first paths.
void AddListing(const KARO::Backup::RsyncWrapper::TransferStats& s,
                PObject& share) {
  share["would_send"] = s.would_send;
  share["would_delete"] = s.would_delete;
  PObject::Array send, del;
  for (const std::string& p : s.send_paths) {
    send.emplace_back(p.substr(0, kMaxListedPath));
  }
  for (const std::string& p : s.delete_paths) {
    del.emplace_back(p.substr(0, kMaxListedPath));
  }
  share["send_paths"] = send;
  share["delete_paths"] = del;
}

// The task's state numbers as the history carries them.
enum TaskStatusNumber { kStatusIdle = 0, kStatusRunning = 1 };

}  // namespace

Daemon::Daemon(const DaemonConfig& config, const Clock& clock)
    : config_(config),
      clock_(clock),
      store_(TaskDir()),
      history_(HistoryDir()) {}

Daemon::~Daemon() { Teardown(); }

int Daemon::Run() {
  if (!Setup()) {
    Teardown();
    return 1;
  }
  Loop();
  Teardown();
  return 0;
}

bool Daemon::Setup() {
  started_ = clock_.WallSeconds();
  std::string error;
  if (!MakeDirs(RunDir() + "/locks", error) || !MakeDirs(HistoryDir(), error) ||
      !MakeDirs(TaskDir(), error) ||
      !MakeDirs(KaroRootPath("/tmp/S2S"), error)) {
    LogError(error);
    return false;
  }
  chmod(TaskDir().c_str(), 0700);
  chmod(HistoryDir().c_str(), 0700);
  chmod(KaroRootPath("/tmp/S2S").c_str(), 0700);
  std::string pid_file = PidFilePath();
  if (KLIBCProcAliveByPidFile(pid_file.c_str())) {
    LogError("already running (pid " +
             std::to_string(KaroReadPidFile(pid_file.c_str())) + ", " +
             pid_file + ")");
    return false;
  }
  if (!WriteFileAtomic(pid_file, std::to_string(getpid()) + "\n", 0644,
                       error)) {
    LogError(error);
    return false;
  }
  // Signals become readable on the loop's descriptor; every thread started
  // from here on inherits the blocked mask.
  sigset_t mask;
  sigemptyset(&mask);
  sigaddset(&mask, SIGTERM);
  sigaddset(&mask, SIGINT);
  sigaddset(&mask, SIGHUP);
  pthread_sigmask(SIG_BLOCK, &mask, nullptr);
  signal(SIGPIPE, SIG_IGN);
  signal_fd_ = signalfd(-1, &mask, SFD_CLOEXEC | SFD_NONBLOCK);
  timer_fd_ = timerfd_create(CLOCK_REALTIME, TFD_CLOEXEC | TFD_NONBLOCK);
  ended_fd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  request_fd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  // The C library's zone: /etc/localtime unless TZ names another.
  zone_fd_ = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (zone_fd_ >= 0 && inotify_add_watch(zone_fd_, "/etc",
                                         IN_CREATE | IN_MOVED_TO |
                                             IN_CLOSE_WRITE | IN_DELETE) < 0) {
    LogInfo("changes of the time zone are not watched");
  }
  if (signal_fd_ < 0 || timer_fd_ < 0 || ended_fd_ < 0 || request_fd_ < 0) {
    LogError(std::string("cannot make the loop's descriptors: ") +
             strerror(errno));
    return false;
  }
  std::vector<std::string> errors;
  Reload(errors);
  CatchUp();
  if (!control_.Start(
          SocketPath(), config_.has_admin_group, config_.admin_gid,
          [this](const PObject& request) { return Handle(request); }, error)) {
    LogError(error);
    return false;
  }
  S2S::Logger::LogMsg(S2S::Logger::Note,
                      "[NOTE] s2sd: started, %zu tasks, socket %s\n",
                      tasks_.size(), SocketPath().c_str());
  return true;
}

void Daemon::Teardown() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    closed_ = true;
    for (Pending* p : requests_) {
      p->reply = MakeReply(kResultBusy, "the service is stopping");
      p->done = true;
    }
    requests_.clear();
  }
  answered_.notify_all();
  control_.Stop();
  for (auto& it : runs_) {
    it.second->cancel.Set();
    if (it.second->thread.joinable()) it.second->thread.join();
  }
  runs_.clear();
  std::vector<unsigned long long> watching;
  for (const auto& it : realtime_) watching.push_back(it.first);
  for (unsigned long long id : watching) StopWatching(id);
  leaving_.clear();  // each one joins its thread
  for (int* fd :
       {&timer_fd_, &signal_fd_, &ended_fd_, &request_fd_, &zone_fd_}) {
    if (*fd >= 0) close(*fd);
    *fd = -1;
  }
  if (started_ != 0) {
    std::string pid_file = PidFilePath();
    if (KaroReadPidFile(pid_file.c_str()) == getpid()) unlink(pid_file.c_str());
    started_ = 0;
  }
}

void Daemon::Loop() {
  ArmTimer();
  std::vector<pollfd> fds;
  while (!(stopping_ && runs_.empty() && leaving_.empty())) {
    fds = {{timer_fd_, POLLIN, 0},
           {signal_fd_, POLLIN, 0},
           {ended_fd_, POLLIN, 0},
           {request_fd_, POLLIN, 0},
           {zone_fd_, POLLIN, 0}};
    WatchFds(fds);
    if (poll(fds.data(), fds.size(), WatchTimeout()) < 0) {
      if (errno == EINTR) continue;
      LogError(std::string("poll: ") + strerror(errno));
      return;
    }
    if (fds[2].revents != 0) OnRunsEnded();
    if (fds[1].revents != 0) OnSignal();
    if (fds[3].revents != 0) OnRequests();
    if (fds[4].revents != 0) OnZoneChange();
    if (fds[0].revents != 0) OnTimer();
    OnWatchers(fds.data() + 5, fds.size() - 5);
  }
  LogInfo("stopped");
}

void Daemon::ArmTimer() {
  long now = clock_.WallSeconds();
  long at = scheduler_.Earliest();
  if (at == 0) at = now + kIdleArm;
  // The timer runs on the system's wall clock; the service's clock may be
  // set apart from it.
  double system_at = clock_.SystemSecondsOf(at);
  itimerspec its = {};
  its.it_value.tv_sec = static_cast<time_t>(system_at);
  its.it_value.tv_nsec = static_cast<long>(
      (system_at - static_cast<double>(its.it_value.tv_sec)) * 1e9);
  if (its.it_value.tv_sec <= 0) its.it_value.tv_sec = 1;
  if (timerfd_settime(timer_fd_, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET,
                      &its, nullptr) != 0) {
    LogError(std::string("cannot arm the timer: ") + strerror(errno));
  }
}

void Daemon::OnTimer() {
  uint64_t expirations = 0;
  ssize_t n = read(timer_fd_, &expirations, sizeof expirations);
  long now = clock_.WallSeconds();
  if (n < 0 && errno == ECANCELED) {
    // The wall clock was set: every next time is computed again.
    LogInfo("the clock changed; next runs recomputed");
    scheduler_.RecomputeAll(now);
  }
  for (const Scheduler::Due& due : scheduler_.TakeDue(now)) {
    std::string error;
    if (!due.retry && !history_.SetLastDue(due.id, due.slot, error)) {
      LogError(error);
    }
    if (!Queue(due.id, due.retry ? "retry" : "schedule")) {
      LogInfo("task " + std::to_string(due.id) +
              " was due while it ran; the run is not repeated");
    }
  }
  ArmTimer();
}

void Daemon::OnZoneChange() {
  alignas(inotify_event) char buf[4096];
  bool zone = false;
  ssize_t n;
  while ((n = read(zone_fd_, buf, sizeof buf)) > 0) {
    for (ssize_t at = 0; at < n;) {
      const inotify_event* e = reinterpret_cast<const inotify_event*>(buf + at);
      std::string name = e->len > 0 ? e->name : "";
      zone = zone || name == "localtime" || name == "timezone";
      at += static_cast<ssize_t>(sizeof(inotify_event) + e->len);
    }
  }
  if (!zone) return;
  tzset();
  LogInfo("the time zone changed; next runs recomputed");
  scheduler_.RecomputeAll(clock_.WallSeconds());
  ArmTimer();
}

void Daemon::OnSignal() {
  signalfd_siginfo info;
  while (read(signal_fd_, &info, sizeof info) == sizeof info) {
    if (info.ssi_signo == SIGHUP) {
      std::vector<std::string> errors;
      Reload(errors);
      ArmTimer();
      continue;
    }
    if (!stopping_) {
      S2S::Logger::LogMsg(S2S::Logger::Note,
                          "[NOTE] s2sd: stopping, %zu runs cancelled\n",
                          runs_.size());
    }
    stopping_ = true;
    SyncWatchers();
    for (auto& it : runs_) it.second->cancel.Set();
    for (unsigned long long id : queue_) tasks_[id].queued = false;
    queue_.clear();
  }
}

void Daemon::Reload(std::vector<std::string>& errors) {
  std::map<unsigned long long, StoredTask> loaded;
  store_.Load(loaded, errors);
  long now = clock_.WallSeconds();
  for (auto it = tasks_.begin(); it != tasks_.end();) {
    if (loaded.count(it->first) == 0) {
      scheduler_.Remove(it->first);
      sessions_.Drop(it->first);
      it = tasks_.erase(it);
    } else {
      ++it;
    }
  }
  for (auto& it : loaded) {
    Task& task = tasks_[it.first];
    bool changed = task.stored.task != it.second.task ||
                   task.stored.enabled != it.second.enabled;
    task.stored = it.second;
    if (changed) {
      scheduler_.Set(it.first, it.second.task.GetInfo().GetSchedule(),
                     it.second.enabled, now);
    }
  }
  LogInfo(std::to_string(tasks_.size()) + " tasks loaded, " +
          std::to_string(errors.size()) + " refused");
  SyncWatchers();
}

void Daemon::CatchUp() {
  long now = clock_.WallSeconds();
  for (auto& it : tasks_) {
    std::string error;
    // A task that never recorded a slot (its file was written by hand) has
    // nothing to catch up.
    // A realtime task's start-up full sync covers the time it was down.
    long last = history_.LastDue(it.first);
    if (last <= 0 || !it.second.stored.enabled ||
        realtime_.count(it.first) != 0) {
      continue;
    }
    long missed =
        it.second.stored.task.GetInfo().GetSchedule().GetNextScheduledSeconds(
            last);
    if (missed <= 0 || missed > now) continue;
    if (!history_.SetLastDue(it.first, now, error)) LogError(error);
    Queue(it.first, "catch-up");
  }
}

bool Daemon::Queue(unsigned long long id, const std::string& trigger,
                   const RunOptions& options) {
  auto it = tasks_.find(id);
  if (stopping_ || it == tasks_.end() || it->second.queued ||
      runs_.count(id) != 0 || realtime_.count(id) != 0) {
    return false;
  }
  it->second.queued = true;
  it->second.queued_trigger = trigger;
  it->second.queued_options = options;
  queue_.push_back(id);
  StartQueued();
  return true;
}

void Daemon::StartQueued() {
  for (auto q = queue_.begin();
       q != queue_.end() &&
       runs_.size() + BatchesInFlight() < config_.max_parallel;) {
    auto it = tasks_.find(*q);
    if (it == tasks_.end()) {
      q = queue_.erase(q);
    } else if (SharesFree(it->second.stored.task.GetInfo().GetShareList())) {
      unsigned long long id = *q;
      q = queue_.erase(q);
      it->second.queued = false;
      Start(id, it->second.queued_trigger);
    } else {
      ++q;
    }
  }
}

PObject Daemon::RunMap(const ActiveRun& run, bool ended) const {
  PObject map;
  map = PObject::Map();
  map["start"] = static_cast<unsigned long long>(run.started);
  map["end"] =
      static_cast<unsigned long long>(ended ? clock_.WallSeconds() : 0);
  map["trigger"] = run.trigger;
  map["dry_run"] = run.options.dry_run;
  // The outcome belongs to the run's thread until the run has ended.
  static const TaskOutcome kRunning;
  const TaskOutcome& out = ended ? run.outcome : kRunning;
  std::string message = !ended              ? "running"
                        : out.error.empty() ? "ok"
                                            : out.error;
  if (run.trigger == "catch-up") {
    message += " (was due while the service was not running)";
  }
  map["outcome"] = ended ? OutcomeOf(out) : "running";
  map["message"] = message;
  map["task_status"] = static_cast<int>(ended ? kStatusIdle : kStatusRunning);
  map["task_result"] = ended ? out.exit_code : 0;
  PObject::Array shares;
  for (const ShareOutcome& s : out.shares) {
    shares.push_back(ShareMap(s, out.dry_run));
  }
  map["shares"] = shares;
  return map;
}

PObject Daemon::ShareMap(const ShareOutcome& s, bool dry_run) {
  PObject share;
  share = PObject::Map();
  share["name"] = s.name;
  share["step"] = !s.ok ? s.failed_step : dry_run ? "transfer" : "finish";
  share["status"] = s.status;
  share["status_text"] = s.ok ? StatusText(0) : s.cause;
  share["seconds"] = static_cast<unsigned long long>(s.seconds + 0.5);
  // rsync's own figures of the transfer.
  share["files"] = s.stats.files_transferred;
  share["bytes"] = s.stats.literal_bytes;
  share["deleted"] = s.stats.files_deleted;
  share["matched"] = s.stats.matched_bytes;
  share["sent"] = s.stats.bytes_sent;
  share["speed"] =
      static_cast<unsigned long long>(s.stats.bytes_per_second + 0.5);
  if (dry_run) AddListing(s.stats, share);
  return share;
}

void Daemon::Start(unsigned long long id, const std::string& trigger) {
  auto run = std::make_shared<ActiveRun>();
  run->id = id;
  run->task = tasks_[id].stored;
  run->trigger = trigger;
  run->options = tasks_[id].queued_options;
  run->options.guard = run->task.guard;
  run->options.share_parallel = config_.share_parallel;
  run->started = clock_.WallSeconds();
  run->beacon_interval = config_.beacon_interval;
  run->sessions = &sessions_;
  runs_[id] = run;
  StartRun(run, [this](unsigned long long ended) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      ended_.push_back(ended);
    }
    Wake(ended_fd_);
  });
  // Written while the run already probes the server: the history's write
  // waits for the disk.
  std::string error;
  if (!history_.Begin(id, RunMap(*run, false), error)) LogError(error);
  LogInfo("task " + std::to_string(id) + " started (" + trigger + ")");
}

void Daemon::OnRunsEnded() {
  Drain(ended_fd_);
  std::vector<unsigned long long> ended;
  std::vector<std::pair<RealtimeSession*, bool>> sessions;
  {
    std::lock_guard<std::mutex> lock(mu_);
    ended.swap(ended_);
    sessions.swap(sessions_done_);
  }
  for (unsigned long long id : ended) Finish(id);
  for (const auto& s : sessions) OnSessionDone(s.first, s.second);
  StartQueued();
  ArmTimer();
}

void Daemon::Finish(unsigned long long id) {
  auto it = runs_.find(id);
  if (it == runs_.end()) return;
  std::shared_ptr<ActiveRun> run = it->second;
  run->thread.join();
  runs_.erase(it);
  PObject map = RunMap(*run, true);
  const TaskOutcome& out = run->outcome;
  long now = clock_.WallSeconds();
  if (run->options.dry_run) {
    // The schedule's retries are not a dry run's business.
  } else if (out.exit_code == kExitCancelled ||
             out.exit_code == kExitDeletions) {
    // Held deletions wait for the operator, not for a retry.
    scheduler_.CancelRetry(id);
  } else if (out.exit_code == kExitOk) {
    scheduler_.ResetRetry(id);
  } else if (!stopping_ && tasks_.count(id) != 0) {
    long at = scheduler_.ScheduleRetry(id, now);
    if (at > 0) {
      map["message"] = map["message"].asString() + "; retry in " +
                       std::to_string((at - now) / 60) + " min";
    }
  }
  std::string error;
  if (!history_.Finish(id, map, error)) LogError(error);
  LogInfo("task " + std::to_string(id) +
          " ended: " + map["message"].asString());
}

PObject Daemon::Handle(const PObject& request) {
  Pending pending;
  pending.request = &request;
  std::unique_lock<std::mutex> lock(mu_);
  if (closed_) return MakeReply(kResultBusy, "the service is stopping");
  requests_.push_back(&pending);
  Wake(request_fd_);
  answered_.wait(lock, [&pending] { return pending.done; });
  return std::move(pending.reply);
}

void Daemon::OnRequests() {
  Drain(request_fd_);
  std::deque<Pending*> requests;
  {
    std::lock_guard<std::mutex> lock(mu_);
    requests.swap(requests_);
  }
  for (Pending* p : requests) {
    PObject reply = Dispatch(*p->request);
    std::lock_guard<std::mutex> lock(mu_);
    p->reply.swap(reply);
    p->done = true;
  }
  answered_.notify_all();
  ArmTimer();
}

}  // namespace s2s_service
