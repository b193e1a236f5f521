// Test plumbing shared by every test program: temporary roots, capture of
// what goes to standard output, standard error and the system log, and free
// loopback ports.
#ifndef S2S_TESTS_TESTUTIL_H_
#define S2S_TESTS_TESTUTIL_H_

#include <string>
#include <vector>

namespace s2s_test {

// A fresh directory under $TMPDIR (or /tmp), removed with everything in it
// when the object goes away.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  // path() + "/" + name.
  std::string Sub(const std::string& name) const;

 private:
  std::string path_;
};

// Redirects a descriptor (1 or 2) into a temporary file for its lifetime and
// hands back what was written.
class CaptureFd {
 public:
  explicit CaptureFd(int fd);
  ~CaptureFd();
  CaptureFd(const CaptureFd&) = delete;
  CaptureFd& operator=(const CaptureFd&) = delete;

  // Everything written so far (flushes stdio first).
  std::string Text();

 private:
  int fd_;
  int saved_;
  std::string file_;
};

// Collects what the library sends to the system log while it lives. Each
// entry is the formatted message; priorities are kept beside them.
class SyslogCapture {
 public:
  SyslogCapture();
  ~SyslogCapture();
  SyslogCapture(const SyslogCapture&) = delete;
  SyslogCapture& operator=(const SyslogCapture&) = delete;

  std::vector<std::string> Messages() const;
  std::vector<int> Priorities() const;
  // All messages joined, for substring checks.
  std::string Text() const;
  void Clear();
};

// Reads a whole file; "" when it cannot be read.
std::string ReadFile(const std::string& path);
// Writes a whole file; true on success.
bool WriteFile(const std::string& path, const std::string& data);
// A TCP port on 127.0.0.1 that was free a moment ago.
int FreeLoopbackPort();

}  // namespace s2s_test

#endif  // S2S_TESTS_TESTUTIL_H_
