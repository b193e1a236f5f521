// Rsyncer: the client side of a sync, everything it does against the server
// through rsync.
//
// An Rsyncer is configured with the server's SyncInfo (Initialize), which
// finds a reachable address and learns the server's protocol version; it
// then pairs the task's shares, announces each share's sync, pushes the
// data, carries an encrypted share's key file across, sends beacons while a
// run lasts and reports the end. Every exchange is one rsync invocation
// through a fresh RsyncTask made on the stack of the operation.
//
// Results: operations that talk to the server return 0 when the invocation
// was made (whatever its outcome) and -1 when it could not be prepared; the
// rsync status of the run (0 = success, otherwise rsync's exit code, the
// wrapper's own status or the server's status) goes only into the `int&`
// out-parameter. Initialize and TestServer return 0, 42 or an rsync status;
// SyncEncryptKey returns an rsync status or 300. Every failure is logged
// once, at ERROR, where it is detected.
//
// Thread-safety: an Rsyncer and its tasks belong to one thread. The cancel
// checker is called on that thread while rsync runs.
#ifndef S2S_RSYNCER_H_
#define S2S_RSYNCER_H_

#include <list>
#include <map>
#include <string>

#include "S2S/export.h"
#include "S2S/s2s_share.h"
#include "S2S/sync_obj_task.h"
#include "karo/rsync_wrapper.h"

namespace S2S {

class S2S_EXPORT Rsyncer {
 public:
  // One configured rsync invocation: the platform's rsync wrapper with the
  // server's credentials. Built, run once and destroyed by one operation.
  class S2S_EXPORT RsyncTask : public KARO::Backup::RsyncWrapper {
   public:
    // Wrapper defaults: delete, numeric ids, appliance authentication
    // (true, true) and pseudo root on.
    RsyncTask();
    ~RsyncTask() override;

    void SetUser(const std::string& user);
    void SetServerIP(const std::string& ip);
    void SetPassword(const std::string& password);
    const std::string& GetUser() const { return user_; }
    const std::string& GetServerIP() const { return serverIP_; }

    void SetSSH(bool on);                   // setSsh
    void SetServerPort(unsigned int port);  // setPort
    void SetCompression(bool on);           // setCompress
    void SetBlockLevelSync(bool on);        // setDeltaCopy
    void SetListOnly(bool on);              // setListOnly
    void SetRelativePath(bool on);          // setRelativePath
    void SetSyncACL(bool on);               // setKaroAcl
    void SetTestTask(bool on);              // setDebugLog(!on)

    // Sends `commands` (a command file's lines) to the server's daemon with a
    // 60 s time-out. Returns the wrapper's status unchanged. A null `cancel`
    // means no cancel check.
    int ExecuteCmd(const std::list<std::string>& commands, bool (*cancel)());
    // Pushes `source` into `module`/`destination` on the server with a 600 s
    // time-out, skipping `excludes`. Returns the wrapper's status unchanged.
    int Execute(const std::string& source, const std::string& module,
                bool (*cancel)(), const std::string& destination,
                const std::list<std::string>& excludes);

   private:
    std::string user_;
    std::string serverIP_;
    std::string password_;
  };

  Rsyncer();
  ~Rsyncer();
  Rsyncer(const Rsyncer&) = delete;
  Rsyncer& operator=(const Rsyncer&) = delete;

  // Does nothing; the hook that the destructor and Initialize call.
  void Clear();
  // `cancel` is polled while rsync runs; true stops the run. Null: never.
  void SetCancelChecker(bool (*cancel)());
  // Copies server IP, user, password, SSH use, the test-task switch and,
  // with SSH only, the SSH port into `task`.
  void InitRsyncTask(RsyncTask& task, bool testTask) const;

  // --- Command files. Each appends the lines of one request to `out` and
  // returns 0, or -1 (logged, nothing appended) when a parameter is empty,
  // the client identity is missing or a share cannot be looked up.
  int GenSinglePairCmd(bool dryRun, std::list<std::string>& out) const;
  int GenServerVersionCmd(const std::string& outfile,
                          std::list<std::string>& out) const;
  int GenSendBeaconCmd(const std::string& taskName,
                       std::list<std::string>& out) const;
  int GenFinishSyncCmd(const std::string& finishType, const std::string& name,
                       std::list<std::string>& out) const;
  int GenStartSyncShareCmd(const std::string& shareName,
                           bool withShareAttributes,
                           std::list<std::string>& out);
  int GenPairMultiSrcCmd(bool dryRun, bool requireEncryptionShareSupport,
                         const std::list<std::string>& shares,
                         const std::string& outfile,
                         std::list<std::string>& out) const;
  // Splits `text` at every character of `separators`, appending the pieces
  // (empty ones included) to `out`. Returns 0.
  static int SplitStringByChars(const std::string& text,
                                const std::string& separators,
                                std::list<std::string>& out);

  // --- Probing. Initialize copies `info` and runs TestServer: 0 when a
  // reachable address was found (and kept in the sync info) and its version
  // read; 42 when the address lookup failed; otherwise the last test's rsync
  // status (213 when no address was tried).
  int Initialize(const SyncInfo& info);
  int TestServer();
  // Takes over what an earlier probe found, without running anything:
  // `probed` is that probe's GetSyncInfo() (its server IP the address that
  // answered) and `serverVersion` its GetServerVersionValue(). For a caller
  // that keeps a probe for later runs. Resume(SyncInfo(), -1) forgets the
  // version held, which would otherwise survive a probe whose every address
  // fails.
  void Resume(const SyncInfo& probed, int serverVersion);
  // A dry-run single pairing. 0 when it ran (`status` 0: reachable; 207 is
  // reported as 0), -1 when the request could not be built.
  int TestProtocol(int& status) const;
  // Asks the server for its protocol version and stores it (0 for a server
  // without the command, -1 when the answer is unreadable). Returns the
  // version held afterwards.
  int GetServerVersion();
  // The version held: -1 unknown, 0 old server, above 0 multi-source.
  int GetServerVersionValue() const { return serverVersion_; }
  bool SupportMultiSource() const;
  SyncInfo GetSyncInfo() const;

  // --- Pairing. `conflicts` receives the shares another client feeds.
  int DoPairing(bool dryRun, const std::list<std::string>& shares,
                std::list<std::string>& conflicts, int& status) const;
  int DoSinglePairing(bool dryRun, int& status) const;
  int DoMultiPairing(bool dryRun, bool requireEncryptionShareSupport,
                     const std::list<std::string>& shares,
                     std::list<std::string>& conflicts, int& status) const;

  // --- A share's sync run.
  // The cached description of a local share: 0, or -1 when unknown.
  int GetShareInfo(const std::string& shareName, ShareInfo& info);
  // Announces a share's sync with its attributes, then, after status 202,
  // in the plain form. 0, or -1 when a request could not be built.
  int StartSyncShare(const std::string& shareName, int& status);
  int StartSyncShare(const std::string& shareName, bool withShareAttributes,
                     int& status);
  // Pushes the whole share (`relativePath` "/") or the path below it.
  // 0 when the run was made or not needed (a vanished path), -1 when the
  // share is unknown.
  int RunSync(unsigned long long taskId, const std::string& shareName,
              const std::string& relativePath,
              const std::list<std::string>& excludes, int& status);
  // Copies an encrypted share's key file over SSH. 0 (also when there is
  // nothing to copy), an rsync status, or 300 on a platform failure.
  int SyncEncryptKey(const std::string& shareName) const;
  int SendBeacon(const std::string& taskName, int& status) const;
  int FinishSync(const std::string& finishType, const std::string& name,
                 int& status) const;

 private:
  // Appends the two fixed lines and `params` as key="value" lines.
  int WriteCommand(const std::string& command,
                   const std::list<std::pair<std::string, std::string>>& params,
                   std::list<std::string>& out) const;

  int serverVersion_;
  bool (*cancel_)();
  SyncInfo syncInfo_;
  std::map<std::string, ShareInfo> shareInfoCache_;
  std::string reserved_;
};

}  // namespace S2S

#endif  // S2S_RSYNCER_H_
