#include "S2S/logger.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <map>
#include <regex>
#include <sstream>
#include <thread>
#include <vector>

#include "testutil.h"

#define S2S_LOG_AREA "logtest"
#include "S2S/log.h"

namespace {

using S2S::Logger;
using s2s_test::Has;
using s2s_test::ReadFile;
using s2s_test::SyslogCapture;
using s2s_test::TempDir;

// Descriptor `fd` (1 or 2) redirected into an anonymous file while it lives.
class CaptureFd {
 public:
  explicit CaptureFd(int fd) : fd_(fd) {
    fflush(nullptr);
    dup2(file_, fd_);
  }
  ~CaptureFd() {
    fflush(nullptr);
    dup2(saved_, fd_);
    close(saved_);
    close(file_);
  }
  std::string Text() const {
    fflush(nullptr);
    return ReadFile("/proc/self/fd/" + std::to_string(file_));
  }

 private:
  int fd_;
  int saved_ = dup(fd_);
  int file_ = memfd_create("capture", MFD_CLOEXEC);
};

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

std::vector<std::string> Lines(const std::string& text) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) out.push_back(line);
  return out;
}

// Every test leaves the logger as a program finds it: system log, errors.
class LoggerTest : public ::testing::Test {
 protected:
  void TearDown() override {
    Logger::Destroy();
    Logger::Initialize(Logger::Syslog, Logger::Error, "", 50);
  }
  TempDir dir_;
};

TEST_F(LoggerTest, SystemLogTakesErrorsFirstAndAlwaysAtTheErrorPriority) {
  SyslogCapture sys;
  Logger::LogMsg(Logger::Error, "first %d\n", 1);
  Logger::LogMsg(Logger::Warning, "dropped\n");
  EXPECT_EQ(sys.Messages(), std::vector<std::string>{"first 1\n"});
  ASSERT_EQ(Logger::Initialize(Logger::Syslog, Logger::Debug, "", 0), 0);
  Logger::Destroy();  // changes nothing unless a file is selected
  Logger::LogMsg(Logger::Debug, "debug line\n");
  EXPECT_EQ(sys.Priorities(), std::vector<int>({3, 3}));
}

TEST_F(LoggerTest, StandardStreamsAreTimestampedFilteredAndPrefixed) {
  const std::regex stamped(
      "[A-Z][a-z]{2} [ 0-9][0-9] [0-9]{2}:[0-9]{2}:[0-9]{2} hello 42");
  for (Logger::Type type : {Logger::Stdout, Logger::Stderr}) {
    CaptureFd out(type == Logger::Stdout ? 1 : 2);
    ASSERT_EQ(Logger::Initialize(type, Logger::Note, "", 0), 0);
    Logger::LogMsg(Logger::Note, "hello %d\n", 42);
    Logger::LogMsg(Logger::Info, "too verbose\n");
    std::vector<std::string> lines = Lines(out.Text());
    ASSERT_EQ(lines.size(), 1u) << type;
    EXPECT_TRUE(std::regex_match(lines[0], stamped)) << lines[0];
  }
  CaptureFd out(1);
  ASSERT_EQ(Logger::Initialize(Logger::Stdout, Logger::Debug, "", 0), 0);
  const int line = __LINE__ + 1;
  LOG_WARNING("value %s", "v");
  LOG_NOTE_NONL("no newline");
  LOG_DEBUG("after");
  std::vector<std::string> lines = Lines(out.Text());
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_TRUE(Has(lines[0], "[WARNING] S2S/logtest(" + std::to_string(line) +
                                "): value v"));
  // The message after one without a newline continues on its line.
  s2s_test::ExpectHas(lines[1], {"): no newline", "[DEBUG] S2S/logtest("});
}

TEST_F(LoggerTest, FailedInitializeKeepsTheStreamAndDestroyLeavesStdout) {
  EXPECT_EQ(Logger::Initialize(Logger::File, Logger::Info, "", 5), -1);
  SyslogCapture sys;
  Logger::LogMsg(Logger::Error, "nowhere\n");
  EXPECT_TRUE(sys.Messages().empty());

  ASSERT_EQ(Logger::Initialize(Logger::Stdout, Logger::Error, "", 0), 0);
  EXPECT_EQ(Logger::Initialize(Logger::File, Logger::Debug,
                               dir_.Sub("missing/dir/log"), 5),
            -1);
  EXPECT_EQ(Logger::GetStream(), stdout);
  // Out-of-range types select a file as well.
  const std::string path = dir_.Sub("any.log");
  ASSERT_EQ(
      Logger::Initialize(static_cast<Logger::Type>(9), Logger::Debug, path, 7),
      0);
  EXPECT_EQ(Logger::GetType(), Logger::File);
  Logger::LogMsg(Logger::Error, "into the file\n");
  Logger::Destroy();
  EXPECT_EQ(Logger::GetType(), Logger::Stderr);  // yet writing to stdout
  CaptureFd out(1);                              // errors only
  Logger::LogMsg(Logger::Error, "after destroy\n");
  Logger::LogMsg(Logger::Warning, "filtered\n");
  EXPECT_TRUE(Has(out.Text(), "after destroy"));
  EXPECT_FALSE(Has(out.Text(), "filtered"));
  EXPECT_TRUE(Has(ReadFile(path), "into the file"));
}

// Writes `len`-byte messages (and a timestamp) until `rotations`: how many.
int WriteUntilRotated(int len, int rotations) {
  std::string text(len - 1, 'x');
  int written = 0;
  for (int seen = 0, before = Logger::GetSize(); seen < rotations; ++written) {
    Logger::LogMsg(Logger::Error, "%s\n", text.c_str());
    int now = Logger::GetSize();
    seen += now < before;
    before = now;
  }
  return written;
}

TEST_F(LoggerTest, RotatesOnTheMessageThatCrossesOneMebibyte) {
  std::string path = dir_.Sub("r.log");
  ASSERT_EQ(Logger::Initialize(Logger::File, Logger::Error, path, 50), 0);
  int messages = WriteUntilRotated(1000, 1);
  EXPECT_EQ(messages, Logger::kRotateSize / 1016 + 1);
  EXPECT_EQ(Logger::GetSize(), 0);
  // The crossing message is the last line of the rotated file.
  EXPECT_EQ(Lines(ReadFile(path + "_0")).size(), static_cast<size_t>(messages));
  Logger::LogMsg(Logger::Error, "next\n");
  EXPECT_TRUE(Has(ReadFile(path), "next"));

  // Rotated files kept: name_0 to name_(kept - 1).
  const struct {
    int depth, rotations, kept;
  } cases[] = {{0, 3, 1}, {1, 3, 1}, {3, 5, 2}};
  for (const auto& c : cases) {
    TempDir dir;
    path = dir.Sub("depth.log");
    ASSERT_EQ(Logger::Initialize(Logger::File, Logger::Error, path, c.depth),
              0);
    WriteUntilRotated(256 * 1024, c.rotations);
    for (int k = -1; k <= c.depth + 1; ++k) {
      EXPECT_EQ(Exists(path + "_" + std::to_string(k)), k >= 0 && k < c.kept)
          << "depth " << c.depth << " file _" << k;
    }
    Logger::Destroy();
  }
}

TEST_F(LoggerTest, FailedRotationSilencesUntilNextInitialize) {
  std::string path = dir_.Sub("s.log");
  ASSERT_EQ(Logger::Initialize(Logger::File, Logger::Error, path, 5), 0);
  unlink(path.c_str());  // the rename of the live file will fail
  WriteUntilRotated(512 * 1024, 1);
  EXPECT_EQ(Logger::GetStream(), nullptr);
  Logger::LogMsg(Logger::Error, "lost\n");
  EXPECT_FALSE(Exists(path));
  ASSERT_EQ(Logger::Initialize(Logger::File, Logger::Error, path, 5), 0);
  Logger::LogMsg(Logger::Error, "back\n");
  EXPECT_TRUE(Has(ReadFile(path), "back"));
}

// Writers racing rotations once found no stream and dropped messages.
TEST_F(LoggerTest, ConcurrentWritersLoseAndInterleaveNothing) {
  std::string path = dir_.Sub("c.log");
  ASSERT_EQ(Logger::Initialize(Logger::File, Logger::Error, path, 50), 0);
  const int kThreads = 8, kLines = 4000;
  const std::string pad(90, 'p');
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([t, &pad] {
      for (int i = 0; i < kLines; ++i) {
        Logger::LogMsg(Logger::Error, "writer %d line %d %s\n", t, i,
                       pad.c_str());
      }
    });
  }
  for (std::thread& th : threads) th.join();

  std::string all;
  for (int k = 48; k >= 0; --k) all += ReadFile(path + "_" + std::to_string(k));
  all += ReadFile(path);
  const std::regex line_re(
      "[A-Z][a-z]{2} [ 0-9][0-9] [0-9:]{8} writer ([0-9]+) line ([0-9]+) "
      "p{90}");
  std::map<int, std::vector<int>> seen;
  for (const std::string& line : Lines(all)) {
    std::smatch m;
    ASSERT_TRUE(std::regex_match(line, m, line_re)) << line;
    seen[std::stoi(m[1])].push_back(std::stoi(m[2]));
  }
  for (int t = 0; t < kThreads; ++t) {
    ASSERT_EQ(seen[t].size(), static_cast<size_t>(kLines));
    for (int i = 0; i < kLines; ++i) ASSERT_EQ(seen[t][i], i);
  }
  EXPECT_TRUE(Exists(path + "_0"));  // the run crossed at least one rotation
}

}  // namespace
