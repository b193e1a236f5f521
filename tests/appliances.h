// A client root and a server root, the server's daemon (configured by its
// own generator) on loopback, and S2S_ROOT and S2S_RSYNC_PORT set so that
// the library under test talks to that daemon as a client would.
#ifndef S2S_TESTS_APPLIANCES_H_
#define S2S_TESTS_APPLIANCES_H_

#include <memory>
#include <string>
#include <vector>

#include "S2S/sync_obj_task.h"
#include "testutil.h"

namespace s2s_test {

class Appliances : NoCopy {
 public:
  // `handler`: the program the daemon's hooks run. S2S_ROOT: the client's.
  explicit Appliances(const std::string& handler);
  ~Appliances();

  // Declares share `name` on every appliance (encrypted: data in "@name@", a
  // key file on the client). Call before StartServer.
  bool AddShare(const std::string& name, bool encrypted = false);
  // Configures and starts the server's daemon, its port in S2S_RSYNC_PORT;
  // `old_server`: the handler answers as a protocol-0 server.
  bool StartServer(bool old_server = false);
  void StopServer();

  // Another client (serial `serial`) with the same shares; Enter() its root.
  std::string AddClient(const std::string& serial);
  // Points S2S_ROOT at `root` until the next Enter or the object's end.
  void Enter(const std::string& root);

  const std::string& client_root() const { return client_root_; }
  const std::string& server_root() const { return server_root_; }
  // A share's directory (an encrypted one's lower) on the client / server.
  std::string ClientShare(const std::string& name) const {
    return ShareDir(client_root_, name);
  }
  std::string ServerShare(const std::string& name) const {
    return ShareDir(server_root_, name);
  }
  // `key` of `section` of the server's registry; "" when absent.
  std::string ServerRegistry(const std::string& section,
                             const std::string& key);

  // What a client knows of the server: 127.0.0.1, user, password, no SSH.
  S2S::SyncInfo Info() const;
  const std::string& user() const { return user_; }
  std::string DaemonLog() const { return daemon_.Log(); }
  // The benchmarks' pulls and CPU counts go to it directly.
  RsyncDaemon& daemon() { return daemon_; }

 private:
  struct Share {
    std::string name;
    bool encrypted;
  };
  bool WriteClient(const std::string& root, const std::string& serial,
                   const std::string& hostname);
  std::string ShareConf(const std::string& root) const;
  std::string ShareDir(const std::string& root, const std::string& name) const;
  bool MakeShareDirs(const std::string& root, const std::string& name) const;

  TempDir dir_;
  std::string client_root_, server_root_, handler_, user_, password_;
  std::vector<Share> shares_;
  std::vector<std::string> roots_;  // the server's and every client's
  std::unique_ptr<ScopedEnv> root_env_;
  std::unique_ptr<ScopedEnv> port_env_;
  RsyncDaemon daemon_;
};

// A stand-in for the server's command handler: a real rsync daemon whose
// command module answers each command as the test chose (answers the real
// handler never gives included) and keeps the last request of each.
class ScriptedServer : NoCopy {
 public:
  explicit ScriptedServer(const std::string& dir);

  // Starts the daemon for `user`; S2S_RSYNC_PORT names its port from then.
  bool Start(const std::string& user, const std::string& password);
  // From now on `command` is answered with `status` and `answer` (else 0).
  void Answer(const std::string& command, int status,
              const std::string& answer = "");
  // From now on the reply to `command` is grown to `size` bytes (a sparse
  // hole after the answer), as a hostile server would flood a client.
  void PadReply(const std::string& command, unsigned long long size);
  // The last `command` received, requestID line included; "" if none came.
  std::string LastRequest(const std::string& command) const;
  // How many commands were received.
  int Count() const;
  RsyncDaemon& daemon() { return daemon_; }

 private:
  std::string dir_;
  RsyncDaemon daemon_;
  std::unique_ptr<ScopedEnv> port_env_;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_APPLIANCES_H_
