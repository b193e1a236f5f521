// RsyncWrapper: one configured invocation of the stock rsync client.
//
// The owner sets the switches, the source and the destination, then calls
// execute() once; the wrapper builds rsync's argument vector, runs rsync in
// its own process group without a terminal, honours the cancel checker while
// it runs and returns rsync's exit status. With a custom command rule set,
// execute() instead sends the command lines to the server's rsync daemon over
// the command channel (rsyncwrapper/README.md) and returns the server's
// status.
//
// Switches and the rsync options they become (a data transfer always runs
// with -a -H, --sparse (runs of zeros become holes on the server),
// --timeout, and --contimeout/--sockopts=TCP_NODELAY on a daemon socket;
// into a share's module also --partial-dir=.s2s-partial, so that the part
// of a file an interrupted transfer had sent stays on the server, in that
// hidden directory beside the file, which rsync itself never sends back
// nor deletes):
//   setDelete(true)          --delete
//   setNumericIds(true)      --numeric-ids
//   setKaroAuth(use, req)    use: log in to the daemon as the user with the
//                            password (RSYNC_PASSWORD in rsync's environment
//                            only); req: refuse to run without user and
//                            password instead of trying anonymously
//   setKaroPseudoRoot(v)     true: owners, groups, devices and specials are
//                            sent (the server's modules keep them with
//                            `fake super`); false: --no-o --no-g --no-D
//   setSsh(true)             -e "ssh -p PORT -o BatchMode=yes ...", the
//                            destination becomes USER@HOST::MODULE/PATH
//   setPort(p)               the SSH port when SSH is on; ignored otherwise
//   setCompress(true)        -z
//   setDeltaCopy(v)          true: --no-whole-file; false: --whole-file
//   setListOnly(true)        --list-only (data transfers only)
//   setRelativePath(true)    -R
//   setKaroAcl(true)         -A -X
//   setDebugLog(true)        -v, and every line rsync prints goes to the log
//   setTimeout(s)            --timeout=s; the connect time-out is the
//                            smaller of s and 15 seconds
//   setExcludeRule(list)     one --exclude=RULE per entry, in order
//   setBandwidthLimit(k)     --bwlimit=k: at most k KiB (1024 bytes) per
//                            second on the wire, averaged by rsync over its
//                            writes; 0 (the default): no limit. Data
//                            transfers only.
//
// The rsync daemon's port is 873 unless the environment variable
// S2S_RSYNC_PORT names another. A module that is an absolute path (the
// key-file directory "/usr/karo/etc/.encrypt") maps onto the daemon's
// key-file module "s2skeys".
//
// Thread-safety: an object belongs to one thread. The cancel checker is
// called on that thread. setLogHandler() is meant to be called once at
// start-up.
#ifndef KARO_RSYNC_WRAPPER_H_
#define KARO_RSYNC_WRAPPER_H_

#include <boost/function.hpp>
#include <list>
#include <memory>
#include <string>
#include <vector>

#if defined(KARO_RSYNC_BUILDING_LIBRARY)
#define KARO_RSYNC_EXPORT __attribute__((visibility("default")))
#else
#define KARO_RSYNC_EXPORT
#endif

namespace KARO {
namespace Backup {

namespace detail {
struct RsyncSettings;
}

class KARO_RSYNC_EXPORT RsyncWrapper {
 public:
  // Statuses of the wrapper's own making; every other non-zero status is
  // rsync's exit code (1-35) or, for a command, the server's status.
  enum Status : int {
    kOk = 0,
    kCancelled = 20,       // the cancel checker stopped the run
    kStartFailed = 250,    // temporary files or the child could not be made
    kBadReply = 251,       // a command ran but its reply was missing/garbled
    kBadSettings = 252,    // destination, command lines or auth incomplete
    kReplyTooLarge = 253,  // a command's reply exceeded the wrapper's cap
  };

  // Where the wrapper's log lines go; `priority` is a syslog priority. The
  // default handler writes to syslog(3). nullptr restores the default.
  using LogHandler = void (*)(int priority, const char* message);
  static void setLogHandler(LogHandler handler);

  // What rsync reports while a data transfer runs (--info=progress2): the
  // whole transfer's figures, not one file's.
  struct TransferProgress {
    unsigned long long bytes_done = 0;   // file data sent or found in place
    unsigned long long bytes_total = 0;  // estimate from the percentage
    unsigned int percent = 0;
    double bytes_per_second = 0;
    unsigned int seconds_left = 0;         // rsync's estimate
    unsigned long long files_checked = 0;  // of the file list so far
    unsigned long long files_total = 0;    // grows while rsync recurses
  };
  // rsync's --stats at the end of a data transfer.
  struct TransferStats {
    bool complete = false;         // the whole block arrived
    unsigned long long files = 0;  // in the file list
    unsigned long long files_transferred = 0;
    unsigned long long files_deleted = 0;
    unsigned long long total_size = 0;
    unsigned long long literal_bytes = 0;  // sent as data
    unsigned long long matched_bytes = 0;  // found on the server already
    unsigned long long bytes_sent = 0;     // on the wire
    unsigned long long bytes_received = 0;
    double bytes_per_second = 0;
    unsigned long long files_created = 0;      // new on the server
    unsigned long long deletions_skipped = 0;  // held back (max_delete)
    // A dry run's itemized changes: entries that would be created or whose
    // data would be sent, and entries that would be deleted, with the
    // first kListedPaths paths of each (directories end in "/").
    static constexpr size_t kListedPaths = 20;
    unsigned long long would_send = 0;
    unsigned long long would_delete = 0;
    std::vector<std::string> send_paths;
    std::vector<std::string> delete_paths;
  };
  // How the calling thread's data transfers run beyond the switches: what
  // the callers of an interface that has no place for it (a share's
  // RunSync) set around the call.
  struct TransferMode {
    // --dry-run --itemize-changes: nothing changes on the server; what
    // would be sent and deleted is counted in lastStats().
    bool dry_run = false;
    // >= 0: --max-delete=N; deletions past N are skipped and counted in
    // lastStats().deletions_skipped, and the run still succeeds.
    long long max_delete = -1;
    // --no-whole-file whatever setDeltaCopy says: what an interrupted
    // transfer left in the partial directory is then the basis of the
    // file, and only the rest is sent (rsync ignores it with --whole-file).
    bool resume = false;
  };
  using ProgressHandler = boost::function<void(const TransferProgress&)>;

  // Defaults: every switch off, time-out 600 s, debug log off.
  RsyncWrapper();
  virtual ~RsyncWrapper();
  RsyncWrapper(const RsyncWrapper&) = delete;
  RsyncWrapper& operator=(const RsyncWrapper&) = delete;

  void setDelete(bool on);
  void setNumericIds(bool on);
  void setKaroAuth(bool useAuth, bool requireAuth);
  void setKaroPseudoRoot(bool on);
  void setSsh(bool on);
  void setPort(unsigned int port);
  void setCompress(bool on);
  void setDeltaCopy(bool on);
  void setListOnly(bool on);
  void setRelativePath(bool on);
  void setKaroAcl(bool on);
  void setDebugLog(bool on);
  void setTimeout(unsigned int seconds);
  void setBandwidthLimit(unsigned int kibPerSecond);

  // The switches as set, for whoever configured the object to check it.
  bool getDelete() const;
  bool getNumericIds() const;
  bool getKaroAuthUse() const;
  bool getKaroAuthRequire() const;
  bool getKaroPseudoRoot() const;
  bool getSsh() const;
  unsigned int getPort() const;  // 0 when never set
  bool getCompress() const;
  bool getDeltaCopy() const;
  bool getListOnly() const;
  bool getRelativePath() const;
  bool getKaroAcl() const;
  bool getDebugLog() const;
  unsigned int getTimeout() const;
  unsigned int getBandwidthLimit() const;  // KiB/s, 0 when unlimited

  // The command lines (key="value", no line breaks). A non-empty rule makes
  // execute() a command; an `outfile="PATH"` line names the local file that
  // receives the server's answer.
  void setKaroCustCmdRule(const std::list<std::string>& lines);
  // Where to: the daemon at `host` as `user`. `module` "" addresses the
  // command channel; `path` is the path inside the module.
  void setDestPath(const std::string& user, const std::string& host,
                   const std::string& password, const std::string& module,
                   const std::string& path);
  void setExcludeRule(const std::list<std::string>& rules);
  void setSrcPath(const std::string& path);

  // Runs the invocation. `cancel` (may be empty) is polled about every 50 ms;
  // once it returns true rsync gets SIGTERM, SIGKILL half a second later.
  // Returns 0 on success; rsync's exit code when rsync failed; for a command
  // the server's status; or one of the statuses above.
  int execute(boost::function<bool()> cancel);

  // Why the last execute() on the calling thread failed, in words: rsync's
  // own error line ("auth failed on module docs", "write failed on
  // \"/x\": No space left on device (28)") or the server's reason for a
  // command's status. "" after a success or when neither said anything.
  // Like errno, it belongs to the thread and the next execute() replaces it.
  static std::string lastError();

  // A handler for the calling thread: while it is set, every data transfer
  // on the thread runs with --info=progress2 --stats, reports each progress
  // line to it (on this thread, from within execute()) and leaves its final
  // figures in lastStats(). An empty handler switches this off again.
  // Either way lastStats() starts empty.
  static void setThreadProgressHandler(const ProgressHandler& handler);
  // The --stats of the calling thread's last data transfer made with a
  // progress handler or a transfer mode other than the default; `complete`
  // is false when rsync did not print them.
  static TransferStats lastStats();
  // The mode of the calling thread's data transfers from now on; a
  // default TransferMode switches it off again.
  static void setThreadTransferMode(const TransferMode& mode);

 private:
  std::unique_ptr<detail::RsyncSettings> settings_;
};

}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_WRAPPER_H_
