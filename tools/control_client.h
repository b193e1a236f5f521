// The front ends' end of the client service's control socket: one request,
// one reply, per connection (doc/service_protocol.md).
//
// A ControlClient names the socket; each Call() connects, sends the request
// map, waits for the reply map and closes. Nothing is kept between calls.
// Thread-safety: a ControlClient holds only the path; calls may run on
// several threads at once.
#ifndef S2S_TOOLS_CONTROL_CLIENT_H_
#define S2S_TOOLS_CONTROL_CLIENT_H_

#include <string>

#include "S2S/pobject.h"
#include "service/control_server.h"  // the result codes

namespace s2s_tools {

class ControlClient {
 public:
  // How a call ended before any reply could be read.
  enum Status {
    kReplied,      // a reply map arrived
    kUnreachable,  // no socket, or nothing listens on it
    kRefused,      // the socket may not be opened by this user
    kBroken,       // connected, but no well-formed reply came back
    kUnsendable,   // the request holds a string the wire cannot carry
  };

  // `socket_path` empty: the daemon's socket under the root (S2S_ROOT).
  explicit ControlClient(const std::string& socket_path = "");

  const std::string& path() const { return path_; }

  // Sends `request` and reads the answer into `reply`. kReplied when a map
  // with a "result" integer and a "message" string arrived (whatever its
  // result); otherwise the status and `error` saying what went wrong, in
  // words.
  Status Call(const S2S::PObject& request, S2S::PObject& reply,
              std::string& error) const;

  // Seconds to wait for the reply (30).
  void set_timeout(unsigned int seconds) { timeout_ = seconds; }

 private:
  std::string path_;
  unsigned int timeout_ = 30;
};

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CONTROL_CLIENT_H_
