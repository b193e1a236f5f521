#include "service/run_worker.h"

#include <set>
#include <vector>

#include "S2S/logger.h"
#include "S2S/s2s_lock.h"
#include "service/config.h"
#include "service/exit_codes.h"

namespace s2s_service {

void ActiveRun::Progress(
    std::string& share, std::string& step,
    KARO::Backup::RsyncWrapper::TransferProgress& transfer) const {
  std::lock_guard<std::mutex> lock(mu_);
  share = share_;
  step = step_;
  transfer = transfer_;
}

std::vector<ActiveRun::ShareProgress> ActiveRun::Shares() const {
  std::lock_guard<std::mutex> lock(mu_);
  std::vector<ShareProgress> shares;
  for (const auto& it : shares_) shares.push_back(it.second);
  return shares;
}

// Runner lines are "probe: ...", "pair: ...", "beacon: ...",
// "share NAME: started|transferred ...|key file copied|finished|..." and
// "task NAME: ...". A share is in progress from its start to any other line
// of its own: its end, a failed step, the guard's or a dry run's summary.
void ActiveRun::Note(const std::string& line) {
  S2S::Logger::LogMsg(S2S::Logger::Info, "[INFO] task %llu: %s\n", id,
                      line.c_str());
  std::lock_guard<std::mutex> lock(mu_);
  size_t colon = line.find(": ");
  // Beacons go out while a transfer runs; any other line ends its progress.
  if (line.compare(0, 7, "beacon:") != 0) {
    transfer_ = KARO::Backup::RsyncWrapper::TransferProgress();
  }
  if (line.compare(0, 6, "share ") == 0 && colon != std::string::npos) {
    share_ = line.substr(6, colon - 6);
    std::string rest = line.substr(colon + 2);
    step_ = rest.substr(0, rest.find(' '));
    // A failed step reads "<step> failed: ...", so the whole rest is
    // matched, not only its first word.
    if (rest == "started" || rest.compare(0, 12, "transferred ") == 0 ||
        rest == "key file copied") {
      shares_[share_] = {share_, step_, {}};
    } else {
      shares_.erase(share_);
    }
  } else if (colon != std::string::npos && line.compare(0, 7, "beacon:") != 0) {
    share_.clear();
    step_ = line.substr(0, line.find_first_of(" :"));
    // The run's end, or its failure, ends its shares too.
    if (line.compare(0, 5, "task ") == 0 || line.compare(0, 6, "error:") == 0) {
      shares_.clear();
    }
  }
}

void StartRun(std::shared_ptr<ActiveRun> run,
              std::function<void(unsigned long long)> done) {
  run->thread = std::thread([run, done] {
    BindCancelFlag(&run->cancel);
    {
      const std::list<std::string>& list =
          run->task.task.GetInfo().GetShareList();
      // In name order, so that two runs never wait for each other's locks.
      std::set<std::string> shares(list.begin(), list.end());
      std::vector<S2S::SimpleFileLock> locks;
      bool locked = true;
      for (const std::string& share : shares) {
        locks.push_back(S2S::LockFactory(ShareLockPath(share)).GetLock());
        if (locks.back().ExLock() != 0) {
          locked = false;
          run->outcome.exit_code = kExitLocal;
          run->outcome.error = "cannot lock share " + share;
          break;
        }
      }
      if (locked) {
        Session session;
        if (run->sessions != nullptr) {
          session = run->sessions->Get(run->task.task, SessionClock());
        }
        run->outcome = RunTask(
            run->task.task, run->task.excludes, run->beacon_interval,
            [&run](const std::string& line) { run->Note(line); },
            [&run](const std::string& share,
                   const KARO::Backup::RsyncWrapper::TransferProgress& p) {
              std::lock_guard<std::mutex> lock(run->mu_);
              run->share_ = share;
              run->step_ = "transfer";
              run->transfer_ = p;
              run->shares_[share] = {share, "transfer", p};
            },
            run->options, run->options.dry_run ? nullptr : &session);
        if (run->sessions != nullptr && !run->options.dry_run)
          run->sessions->Put(run->task.task, session);
      }
    }
    BindCancelFlag(nullptr);
    done(run->id);
  });
}

}  // namespace s2s_service
