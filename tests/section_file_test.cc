#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>

#include "karo_err.h"
#include "karo_section.h"
#include "testutil.h"

namespace {

using s2s_test::Hash;
using s2s_test::MakeHash;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

// The error a call that returned -1 left behind; 0 for any other result.
int ErrorOf(int rc) { return rc == -1 ? KLIBCErrGet() : 0; }

std::string Error(int code) { return "<error " + std::to_string(code) + ">"; }

class SectionFileTest : public ::testing::Test {
 protected:
  std::string Value(const char* section, const char* key, size_t size = 256) {
    char buf[256];
    if (KLIBCFileGetSectionValue(file_.c_str(), section, key, buf, size) < 0)
      return Error(KLIBCErrGet());
    return buf;
  }
  int Add(const char* section, const Hash& h, const char* format = nullptr) {
    return KLIBCFileAddSection(file_.c_str(), section, h.get(), format);
  }
  int Modify(const char* section, const Hash& h, int create = 0) {
    return KLIBCIFileModifySection(file_.c_str(), section, 0, h.get(), create,
                                   0);
  }
  int Set(const char* section, const Hash& h) {
    return KLIBCFileSetSection(file_.c_str(), section, 0, h.get(), nullptr);
  }
  // The section names, joined by ':', or the enumeration's error.
  std::string Names() {
    KSZLIST* names = KLIBCSzListAlloc();
    int n = KLIBCFileEnumSection(file_.c_str(), names);
    std::string out = n < 0 ? Error(KLIBCErrGet()) : "";
    for (int i = 0; i < n; ++i)
      out += (i ? ":" : "") + std::string(KLIBCSzListGet(names, i));
    KLIBCSzListFree(names);
    return out;
  }

  s2s_test::TempDir dir_;
  std::string file_ = dir_.Sub("reg.info");
};

TEST_F(SectionFileTest, WritesTheDocumentedFormatAndReadsItBack) {
  ASSERT_EQ(Add("SHARE_a",
                MakeHash({{"RunningID", "c1"}, {"quote", "say \"hi\" \""}})),
            1);
  ASSERT_EQ(
      Add("TASK_1", MakeHash({{"status", "idle"}}), KLIBC_SECTION_PAIR_FORMAT),
      1);
  EXPECT_EQ(ReadFile(file_),
            "[SHARE_a]\n\tRunningID=\"c1\"\n\tquote=\"say \"hi\" \"\"\n"
            "[TASK_1]\n\tstatus=\"idle\"\n");
  EXPECT_EQ(s2s_test::Mode(file_), 0644);
  EXPECT_EQ(Value("SHARE_a", "quote"), "say \"hi\" \"");
  Hash got = MakeHash();
  EXPECT_EQ(KLIBCFileGetSection(file_.c_str(), "SHARE_a", got.get()), 1);
  EXPECT_EQ(KLIBCSzHashCount(got.get()), 2);
  EXPECT_EQ(KLIBCFileGetSection(file_.c_str(), "SHARE_b", got.get()), 0);
  EXPECT_EQ(Names(), "SHARE_a:TASK_1");
}

TEST_F(SectionFileTest, ModifySetAndAddKeepOtherSectionsAndKeys) {
  auto a = MakeHash({{"k1", "1"}, {"k2", "2"}});
  ASSERT_EQ(Add("A", a), 1);
  ASSERT_EQ(Add("B", a), 1);
  auto mod = MakeHash({{"k2", "two"}, {"k3", ""}});
  EXPECT_EQ(Modify("A", mod), 1);
  EXPECT_EQ(Value("A", "k1"), "1");
  EXPECT_EQ(Value("A", "k2"), "two");
  EXPECT_EQ(Value("A", "k3"), "");
  EXPECT_EQ(Modify("C", mod), 0);
  EXPECT_EQ(Set("B", mod), 2);
  EXPECT_EQ(Value("B", "k1"), Error(KERR_NOT_FOUND));
  EXPECT_EQ(ErrorOf(Set("C", mod)), KERR_NOT_FOUND);
  // Adding an existing section replaces it instead of duplicating it.
  EXPECT_EQ(Add("A", a), 1);
  EXPECT_EQ(Value("A", "k2"), "2");
  EXPECT_EQ(Names(), "A:B");
}

TEST_F(SectionFileTest, MissingFileAndSmallBuffer) {
  char buf[5];
  EXPECT_EQ(KLIBCFileExist(file_.c_str()), 0);
  EXPECT_EQ(Value("A", "k"), Error(KERR_FILE_NOT_FOUND));
  auto mod = MakeHash({{"k", "long"}});
  EXPECT_EQ(ErrorOf(Modify("A", mod)), KERR_FILE_NOT_FOUND);
  EXPECT_EQ(Modify("A", mod, 1), 0);
  EXPECT_EQ(KLIBCFileExist(file_.c_str()), 1);
  ASSERT_EQ(Add("A", mod), 1);
  EXPECT_EQ(Value("A", "k", 4), Error(KERR_BUFFER_TOO_SMALL));
  EXPECT_EQ(KLIBCFileGetSectionValue(file_.c_str(), "A", "k", buf, 5), 4);
}

TEST_F(SectionFileTest, ReadsWhatAPersonTypes) {
  ASSERT_TRUE(WriteFile(file_,
                        "# registry\n\n  [ A ]  \r\n"
                        "k1 = \"v 1\"   \n\n\tk2=plain\n[B]\n[A]\nk3=\"\"\n"));
  EXPECT_EQ(Value("A", "k1"), "v 1");
  EXPECT_EQ(Value("A", "k2"), "plain");
  EXPECT_EQ(Value("A", "k3"), "");
  EXPECT_EQ(Names(), "A:B");

  // A section given again: a repeated key keeps its first place and takes the
  // last value, below and above the indexing size.
  std::string many = "[M]\nk0=\"a\"\n";
  for (int i = 1; i < 30; ++i) many += "k" + std::to_string(i) + "=\"x\"\n";
  many += "[N]\nk0=\"n\"\n[M]\nk0=\"b\"\nk29=\"c\"\nk30=\"d\"\n";
  ASSERT_TRUE(WriteFile(file_, many));
  Hash got = MakeHash();
  ASSERT_EQ(KLIBCFileGetSection(file_.c_str(), "M", got.get()), 1);
  ASSERT_EQ(KLIBCSzHashCount(got.get()), 31);
  EXPECT_STREQ(KLIBCSzHashKeyAt(got.get(), 0), "k0");
  EXPECT_STREQ(KLIBCSzHashValueAt(got.get(), 0), "b");
  EXPECT_STREQ(KLIBCSzHashValueAt(got.get(), 29), "c");
  EXPECT_STREQ(KLIBCSzHashKeyAt(got.get(), 30), "k30");
  EXPECT_EQ(Value("N", "k0"), "n");

  for (const char* bad : {"k=\"v\"\n", "[A]\nno equals\n", "[A]\n=v\n", "[A\n",
                          "[]\n", "[A]\nk=\"open\n"}) {
    ASSERT_TRUE(WriteFile(file_, bad));
    EXPECT_EQ(Names(), Error(KERR_FILE_FORMAT)) << bad;
  }
}

// A file in the writers' own form keeps all but the changed section; one that
// reads otherwise than it looks is rewritten whole.
TEST_F(SectionFileTest, RewriteKeepsTheWritersFormAndNormalisesTheRest) {
  const struct {
    const char* in;
    const char* out;
  } cases[] = {
      {"[A]\n\tk=\"1\"\n[B]\n\tk=\"2\"\n[C]\n\tx=\"y = \"z\"\"\n",
       "[A]\n\tk=\"1\"\n[B]\n\tk=\"3\"\n[C]\n\tx=\"y = \"z\"\"\n"},
      {"[A]\n\t#k=\"1\"\n[B]\n\tk=\"2\"\n", "[A]\n[B]\n\tk=\"3\"\n"},
      {"[A]\n\tk=\"1\"\n\tk=\"9\"\n[B]\n", "[A]\n\tk=\"9\"\n[B]\n\tk=\"3\"\n"},
      {"[A]\n\tk=\"1\"\n[B]\n\tk=\"2\"", "[A]\n\tk=\"1\"\n[B]\n\tk=\"3\"\n"},
      {"[A]\n\tk=\"1\"\n[B]\n[A]\n\tj=\"3\"\n",
       "[A]\n\tk=\"1\"\n\tj=\"3\"\n[B]\n\tk=\"3\"\n"},
      {"[A]\n\tk =\"1\"\n[B]\n", "[A]\n\tk=\"1\"\n[B]\n\tk=\"3\"\n"},
  };
  auto mod = MakeHash({{"k", "3"}});
  for (const auto& c : cases) {
    ASSERT_TRUE(WriteFile(file_, c.in));
    EXPECT_EQ(Modify("B", mod), 1) << c.in;
    EXPECT_EQ(ReadFile(file_), c.out) << c.in;
  }
  EXPECT_EQ(Value("A", "k"), "1");
  ASSERT_TRUE(WriteFile(file_, cases[0].in));
  EXPECT_EQ(Value("C", "x"), "y = \"z\"");
}

TEST_F(SectionFileTest, RefusesWhatTheFormatCannotHold) {
  auto good = MakeHash({{"k", "v"}});
  ASSERT_EQ(Add("A", good), 1);
  const std::string before = ReadFile(file_);
  for (const char* section : {"", "a]b", "[x", "line\nbreak", " lead", "#c"})
    EXPECT_EQ(ErrorOf(Add(section, good)), KERR_VALUE_UNHOLDABLE) << section;
  for (const char* key : {"a=b", "q\"", "[k", "trail ", "cr\r", ""}) {
    EXPECT_EQ(ErrorOf(Modify("A", MakeHash({{key, "v"}}))),
              KERR_VALUE_UNHOLDABLE)
        << key;
  }
  for (const char* value : {"two\nlines", "cr\r"}) {
    EXPECT_EQ(ErrorOf(Set("A", MakeHash({{"k", value}}))),
              KERR_VALUE_UNHOLDABLE);
  }
  EXPECT_EQ(ErrorOf(Add("A", good, "%s=%s\n")), KERR_INVALID_ARG);
  EXPECT_EQ(ReadFile(file_), before);
}

// Wherever SIGKILL lands in a writer's rewrites, the file is a whole version.
TEST_F(SectionFileTest, WriterKilledAtRandomLeavesAParsableFile) {
  std::mt19937 rng(12345);
  for (int round = 0; round < 20; ++round) {
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      Hash h = MakeHash();
      for (int i = 0;; ++i) {
        std::string v(200, static_cast<char>('a' + i % 26));
        for (int k = 0; k < 20; ++k) {
          KLIBCSzHashSetValue(h.get(), ("key" + std::to_string(k)).c_str(),
                              v.c_str());
        }
        std::string s = "S" + std::to_string(i % 40);
        if (Add(s.c_str(), h) != 1 || write(ready[1], "x", 1) != 1) _exit(1);
      }
    }
    close(ready[1]);
    char c;
    int writes = 1 + static_cast<int>(rng() % 4);
    for (int i = 0; i < writes; ++i) ASSERT_EQ(read(ready[0], &c, 1), 1);
    struct timespec pause = {0, static_cast<long>(rng() % 2000) * 1000};
    nanosleep(&pause, nullptr);
    kill(pid, SIGKILL);
    int status;
    waitpid(pid, &status, 0);
    close(ready[0]);
    ASSERT_TRUE(WIFSIGNALED(status));

    // Every section whole: its first and last keys hold the same 200 bytes.
    const std::string names = Names() + ":";
    ASSERT_EQ(names[0], 'S') << "round " << round << ": " << names;
    for (size_t at = 0, end; (end = names.find(':', at)) != names.npos;
         at = end + 1) {
      const std::string s = names.substr(at, end - at);
      const std::string first = Value(s.c_str(), "key0");
      ASSERT_EQ(Value(s.c_str(), "key19"), std::string(200, first[0])) << s;
    }
  }
}

TEST(StringHelpers, HashKeepsOrderAndCapacityListCopiesStrGetFormats) {
  KSZHASH* h = KLIBCSzHashAlloc(2);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "b", "1"), 0);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "a", "2"), 0);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "b", "3"), 0);  // replaced in place
  EXPECT_EQ(ErrorOf(KLIBCSzHashSetValue(h, "c", "4")), KERR_NO_MEMORY);
  EXPECT_STREQ(KLIBCSzHashKeyAt(h, 0), "b");
  EXPECT_STREQ(KLIBCSzHashValueAt(h, 0), "3");
  EXPECT_EQ(KLIBCSzHashKeyAt(h, 2), nullptr);
  EXPECT_EQ(KLIBCSzHashGetValue(h, "c"), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  EXPECT_EQ(KLIBCSzHashRemove(h, "b"), 0);
  EXPECT_EQ(KLIBCSzHashRemove(h, "b"), -1);
  EXPECT_STREQ(KLIBCSzHashGetValue(h, "a"), "2");
  KLIBCSzHashClear(h);
  EXPECT_EQ(KLIBCSzHashCount(h), 0);
  KLIBCSzHashFree(h);
  EXPECT_EQ(KLIBCSzHashAlloc(0), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);

  KSZLIST* l = KLIBCSzListAlloc();
  char s[] = "one";
  EXPECT_EQ(KLIBCSzListPush(l, s), 0);
  s[0] = 'X';
  EXPECT_EQ(KLIBCSzListPush(l, "two"), 0);
  EXPECT_EQ(KLIBCSzListPush(l, nullptr), -1);
  EXPECT_EQ(KLIBCSzListCount(l), 2);
  EXPECT_STREQ(KLIBCSzListGet(l, 0), "one");
  EXPECT_EQ(KLIBCSzListGet(l, 2), nullptr);
  KLIBCSzListFree(l);
  char* f = KLIBCStrGet("SHARE_%s_%d", "a", 7);
  EXPECT_STREQ(f, "SHARE_a_7");
  KLIBCStrPut(f);
  KLIBCStrPut(nullptr);
}

// A key per test process, removed afterwards: parallel tests share no lock.
class SemaphoreTest : public ::testing::Test {
 protected:
  void TearDown() override {
    int id = semget(key_, 1, 0);
    if (id >= 0) semctl(id, 0, IPC_RMID);
  }
  const int key_ = 0x53320000 | (getpid() & 0xffff);
};

TEST_F(SemaphoreTest, HolderKilledGivesTheLockBack) {
  for (bool timed : {false, true}) {
    int held[2];
    ASSERT_EQ(pipe(held), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      int sem = KLIBCSemOpen(key_);
      if (sem < 0 ||
          (timed ? KLIBCSemLockTimed(sem, 1000) : KLIBCSemLock(sem)) != 0 ||
          write(held[1], "x", 1) != 1) {
        _exit(1);
      }
      pause();
      _exit(0);
    }
    char c;
    ASSERT_EQ(read(held[0], &c, 1), 1);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    close(held[0]);
    close(held[1]);
    int sem = KLIBCSemOpen(key_);
    ASSERT_GE(sem, 0);
    EXPECT_EQ(KLIBCSemLockTimed(sem, 1000), 0) << timed;
    EXPECT_EQ(semctl(sem, 0, GETVAL), 0);
    EXPECT_EQ(KLIBCSemUnlock(sem), 0);
    EXPECT_EQ(semctl(sem, 0, GETVAL), 1);
    EXPECT_EQ(KLIBCSemClose(sem), 0);
  }
  EXPECT_EQ(ErrorOf(KLIBCSemOpen(IPC_PRIVATE)), KERR_LOCK);
  EXPECT_EQ(KLIBCSemClose(-1), -1);
}

}  // namespace
