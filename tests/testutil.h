// Test plumbing shared by every test program: temporary roots, the system
// log's capture, loopback sockets and the programs a test starts.
#ifndef S2S_TESTS_TESTUTIL_H_
#define S2S_TESTS_TESTUTIL_H_

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "S2S/channel.h"
#include "S2S/is_syncedshare.h"
#include "S2S/logger.h"

namespace s2s_test {

// The plumbing below owns files, descriptors and processes: none is copied.
struct NoCopy {
  NoCopy() = default;
  NoCopy(const NoCopy&) = delete;
  NoCopy& operator=(const NoCopy&) = delete;
};

// A fresh directory under $TMPDIR (or /tmp), removed whole with the object.
class TempDir : NoCopy {
 public:
  TempDir();
  ~TempDir();

  const std::string& path() const { return path_; }
  std::string Sub(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Collects what the library sends to the system log while it lives. Each
// entry is the formatted message; priorities are kept beside them.
class SyslogCapture : NoCopy {
 public:
  SyslogCapture();
  ~SyslogCapture();

  std::vector<std::string> Messages() const;
  std::vector<int> Priorities() const;
  // All messages joined, for substring checks.
  std::string Text() const;
  void Clear();
};

// Routes the library's log, every message up to `level`, into the capture for
// its lifetime; afterwards the logger is back on the system log, errors only.
class LogCapture : public SyslogCapture {
 public:
  explicit LogCapture(int level = 7) {
    S2S::Logger::Initialize(S2S::Logger::Syslog, level, "", 0);
  }
  ~LogCapture() {
    S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Error, "", 0);
  }
};

// Two connected stream sockets: a Unix-domain socketpair, or a TCP
// connection over 127.0.0.1. Both ends blocking; false on failure.
bool UnixSocketPair(int fds[2]);
bool TcpSocketPair(int fds[2]);

// Channel `a` on one end of a socket pair (Unix, or TCP over loopback); the
// other, `peer`, is the test's until Both() opens channel `b` on it.
struct ChannelPair : NoCopy {
  explicit ChannelPair(unsigned int capacity, bool tcp = false);
  ~ChannelPair();
  bool Both() { return ok && b.Open(peer, true) == 0; }
  // What has reached `peer` so far, without waiting.
  std::string Pending();

  S2S::Channel a, b;
  int peer = -1;
  bool ok = false;
};

// Whether `text` holds `what`.
inline bool Has(const std::string& text, const std::string& what) {
  return text.find(what) != std::string::npos;
}
// Checks that every one of `parts` is in `text`.
void ExpectHas(const std::string& text,
               std::initializer_list<std::string> parts);
// Seconds of the steady clock since `start`.
inline double SecondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start)
      .count();
}

// Reads a whole file; "" when it cannot be read.
std::string ReadFile(const std::string& path);
// Writes a whole file and gives it `mode` (unless -1); true on success.
bool WriteFile(const std::string& path, const std::string& data, int mode = -1);
// A new socket connected to 127.0.0.1:`port`, or -1.
int ConnectLoopback(int port);
// The permission bits of `path`, or -1 when it has none.
int Mode(const std::string& path);
// A TCP port on 127.0.0.1 that was free a moment ago.
int FreeLoopbackPort();
// A socket listening on 127.0.0.1 at *port (0: any free one, stored there),
// or -1; the kernel completes connections whether or not they are accepted.
int LoopbackListener(int* port);

// SIGTERM to this process's child *pid (if > 0), reaped; *pid becomes -1.
void StopChild(pid_t* pid);

// Starts what `argv_for` gives for a free loopback port (nothing: give up),
// output appended to `log`, until it accepts there, on other ports too (one
// found free may be taken before it binds). Its pid (port in *port), or -1.
pid_t SpawnListening(
    const std::function<std::vector<std::string>(int)>& argv_for,
    const std::string& log, int* port);

// A real rsync daemon on 127.0.0.1 at a free port, in the foreground and
// stopped by its own pid; its log lives in `dir`.
class RsyncDaemon : NoCopy {
 public:
  explicit RsyncDaemon(const std::string& dir) : dir_(dir) {}
  ~RsyncDaemon() { Stop(); }

  // Starts the daemon on configuration `conf`; false when it does not answer.
  bool StartWithConfig(const std::string& conf);
  // SIGTERM to the daemon, then waits for it. Idempotent.
  void Stop();

  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  // The daemon's log file so far.
  std::string Log() const;

 private:
  std::string dir_;
  int port_ = -1;
  pid_t pid_ = -1;
};

// Sets an environment variable for the lifetime of the object and restores
// the previous value afterwards; the C library rereads TZ (tzset) both times.
class ScopedEnv : NoCopy {
 public:
  ScopedEnv(const std::string& name, const std::string& value);
  ~ScopedEnv();

 private:
  std::string name_;
  bool had_ = false;
  std::string old_;
};

// A TempDir that S2S_ROOT points at while it lives, so that every fixed
// system path of the platform layer lands inside it.
class TempRoot : public TempDir {
 public:
  TempRoot();

  std::string Path(const std::string& abs) const { return path() + abs; }
  // Writes Path(abs), making the directories above it; true on success.
  bool Write(const std::string& abs, const std::string& data) const;
  // Creates Path(abs) and the directories above it.
  bool MakeDir(const std::string& abs) const;

 private:
  ScopedEnv env_;
};

// Starts `args` (looked up in PATH, no shell) with standard input `in` and
// output and error `out` (-1: inherited); its pid, or -1.
pid_t Exec(std::vector<std::string> args, int in, int out);
// Runs `args` (in PATH, no shell), in and out on /dev/null; true on exit 0.
bool RunQuiet(const std::vector<std::string>& args);

// A program started by Spawn: its exit code and output, once Wait returned.
struct Child {
  pid_t pid = -1;
  std::string out_path, err_path;
  std::string out, err;
  int code = -1;

  // Waits at most `seconds` (then kills it); its exit code, or 128 + signal.
  int Wait(int seconds = 60);
};

// Starts `argv` (a path, no shell) with output in files in `dir`; each of
// `env` is "NAME=VALUE" to set or "NAME" to remove in the child.
Child Spawn(const std::string& dir, const std::vector<std::string>& argv,
            const std::vector<std::string>& env = {});
// Spawn, then Wait.
Child RunProgram(const std::string& dir, const std::vector<std::string>& argv,
                 const std::vector<std::string>& env = {});

// Runs `child`(i) in `n` forked processes released at once; their exit codes
// (-1: killed by a signal).
std::vector<int> RunInChildren(int n, const std::function<int(int)>& child);

// Polls `done` every `every` s until it holds (true) or `seconds` passed.
bool WaitUntil(const std::function<bool()>& done, double seconds,
               double every = 0.005);

// An executable "#!/bin/sh" script `body` at `path`; true on success.
inline bool WriteScript(const std::string& path, const std::string& body) {
  return WriteFile(path, "#!/bin/sh\n" + body, 0755);
}

// A hash of the platform layer holding `kv`, freed with the pointer.
using Hash = std::unique_ptr<KSZHASH, void (*)(KSZHASH*)>;
Hash MakeHash(
    std::initializer_list<std::pair<const char*, const char*>> kv = {});
// `key` of section `section` of the registry under S2S_ROOT; "" if absent.
std::string RegistryValue(const std::string& section, const std::string& key);

}  // namespace s2s_test

#endif  // S2S_TESTS_TESTUTIL_H_
