// The control socket's connections, one at a time on a thread of their own,
// so that a slow or hostile peer never holds up the service's loop.
//
// For each connection the request is read with a deadline (kRequestSeconds
// for the whole of it) and a size limit (kMaxRequest) and decoded
// (service/wire_reader.h); a peer (SO_PEERCRED) that is neither root, nor
// the service's own user, nor in the admin group then gets one reply with
// result 6; any other request goes to the handler and its reply is sent. Bytes
// that cannot be a message, a peer that goes away or one that is too slow get
// no reply: the connection is closed and the next one served.
#ifndef S2S_SERVICE_CONTROL_SERVER_H_
#define S2S_SERVICE_CONTROL_SERVER_H_

#include <sys/types.h>

#include <functional>
#include <string>
#include <thread>

#include "S2S/ipc.h"
#include "S2S/pobject.h"

namespace s2s_service {

// Result codes of the control protocol (doc/service_protocol.md).
enum ControlResult : unsigned int {
  kResultOk = 0,
  kResultMalformed = 1,
  kResultUnknownAction = 2,
  kResultUnknownTask = 3,
  kResultInvalidTask = 4,
  kResultBusy = 5,
  kResultNotPermitted = 6,
  kResultInternal = 7,
};

// A reply: "result" and "message" (cut to kMaxMessage bytes).
S2S::PObject MakeReply(unsigned int result, const std::string& message);

class ControlServer {
 public:
  static constexpr int kRequestSeconds = 5;
  static constexpr size_t kMaxRequest = 1 << 20;
  static constexpr size_t kMaxMessage = 1024;

  using Handler = std::function<S2S::PObject(const S2S::PObject& request)>;

  ControlServer() = default;
  ~ControlServer();
  ControlServer(const ControlServer&) = delete;
  ControlServer& operator=(const ControlServer&) = delete;

  // Listens at `path` (mode 0600, or 0660 with the admin group's group)
  // and starts the thread, which calls `handler` for each request. True, or
  // false with `error`.
  bool Start(const std::string& path, bool has_admin_group, gid_t admin_gid,
             Handler handler, std::string& error);
  // Stops the thread and removes the socket.
  void Stop();

 private:
  void Serve();
  void Connection(int fd);
  bool Permitted(int fd) const;

  S2S::IPCListener listener_;
  Handler handler_;
  bool has_admin_group_ = false;
  gid_t admin_gid_ = 0;
  int stop_fd_ = -1;
  std::thread thread_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_CONTROL_SERVER_H_
