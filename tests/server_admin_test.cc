// s2s-server's administration: shares, SSH mode, refused command lines.
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "gtest/gtest.h"
#include "testutil.h"

namespace {

using s2s_test::Child;
using s2s_test::Has;
using s2s_test::ReadFile;

// A row: the words after "s2s-server --root ROOT", its exit code and output.
struct Case {
  std::vector<std::string> words;
  int code;
  std::string says;
};

void RunCases(const s2s_test::TempDir& tmp, const std::string& root,
              const std::vector<Case>& cases) {
  for (Case c : cases) {
    c.words.insert(c.words.begin(), {S2S_SERVER_PROGRAM, "--root", root});
    Child r = s2s_test::RunProgram(tmp.path(), c.words, {"S2S_ROOT"});
    SCOPED_TRACE(testing::PrintToString(c.words) + "\n" + r.out + r.err);
    EXPECT_EQ(c.code, r.code);
    EXPECT_TRUE(Has(r.out + r.err, c.says));
  }
}

// SSH mode for the daemon user "nobody": its key may only start the daemon
// on a configuration it can run, whose secrets only it reads; a share added
// later is handed to it too. So started, as that user, the daemon serves.
TEST(ServerAdmin, SharesAndSshModeForAnOrdinaryDaemonUser) {
  const passwd* nobody = getpwnam("nobody");
  if (geteuid() != 0 || nobody == nullptr)
    GTEST_SKIP() << "needs root and the user nobody";
  s2s_test::TempDir tmp;
  ASSERT_EQ(0, chmod(tmp.path().c_str(), 0755));
  const std::string root = tmp.Sub("server"), pw = tmp.Sub("password");
  const std::string key = tmp.Sub("key.pub"), keys = tmp.Sub("ssh/keys");
  ASSERT_EQ(0, mkdir(tmp.Sub("ssh").c_str(), 0755));
  ASSERT_TRUE(s2s_test::WriteFile(pw, "pw-ssh-admin\n", 0600));
  // The hooks run as the user, who may not reach the build tree.
  const std::string handler = tmp.Sub("s2s-cmd-handler");
  std::filesystem::copy(S2S_HANDLER_PROGRAM, handler);
  const std::string blob = "AAAAC3NzaC1lZDI1NTE5AAAAIBv2";
  ASSERT_TRUE(s2s_test::WriteFile(key, "ssh-ed25519 " + blob + " me@client\n"));
  ASSERT_TRUE(s2s_test::WriteFile(keys,
                                  "ssh-rsa OTHER other@host\n"
                                  "ssh-ed25519 " +
                                      blob + " old\n"));
  const std::string bad = tmp.Sub("bad.pub");
  ASSERT_TRUE(s2s_test::WriteFile(bad, "not a key\n"));
  RunCases(
      tmp, root,
      {{{"share", "list"}, 1, "no server root at " + root},
       {{"init", "--share", "docs", "--user", "nobody", "--password-file", pw,
         "--handler", handler},
        0,
        "config: daemon user nobody"},
       {{"ssh-setup", "--user", "nobody", "--key-file", bad,
         "--authorized-keys", keys},
        1,
        "not an OpenSSH public key"},
       {{"ssh-setup", "--user", "nobody", "--key-file", tmp.Sub("none"),
         "--authorized-keys", keys},
        1,
        "cannot read the public key"},
       {{"ssh-setup", "--user", "daemon", "--key-file", key},
        1,
        "has no user daemon"},
       // SSH mode never logs in as root, and only as the daemon user.
       {{"ssh-setup", "--user", "root", "--key-file", key},
        1,
        "may not be root"},
       {{"ssh-setup", "--user", "s2s-no-such-user", "--key-file", key},
        1,
        "no system user s2s-no-such-user"},
       {{"ssh-setup", "--user", "nobody", "--key-file", key,
         "--authorized-keys", keys},
        0,
        "nobody may log in with that key only to run the daemon"},
       {{"share", "add", "extra", "--encrypted"}, 0, "configuration rewritten"},
       {{"share", "list"}, 0, root + "/volume1/extra, encrypted"},
       {{"share", "remove", "nosuch"}, 1, "no share nosuch"},
       {{"share", "remove", "extra"}, 0, "share: extra removed"},
       // What the daemon would misread, or what would mix data.
       {{"share", "add", "%RSYNC_USER_NAME%"}, 1, "no '%'"},
       {{"share", "add", "tr=" + root + "/volume1/docs "},
        1,
        "end with a blank"},
       {{"share", "add", "a b  c"}, 1, "two blanks in a row"},
       {{"share", "add", "Docs"}, 1, "only in case"},
       {{"share", "add", "S2SCMD"}, 1, "the daemon's own"},
       {{"share", "add", "docs"}, 1, "is there already"},
       {{"share", "add", "all=" + root}, 1, "the server's own"},
       {{"share", "add", "vol=" + root + "/volume1"}, 1, "each other's data"},
       {{"share", "add", "sys=/etc/ssh"}, 1, "a system directory"},
       {{"share", "add", "x:y"}, 2, "none of / \\ [ ]"},
       {{"config", "--user", "a b"}, 2, "bad daemon user a b (1-64 of"},
       {{"release"}, 2, "give the share's name"},
       {{"share", "move", "docs"}, 2, "share add NAME[=PATH]"},
       {{"stop"}, 0, "was not running"},
       {{"status", "extra"}, 2, "unexpected arguments to status"},
       {{"reset-pairing"}, 0, "not bound to one client"},
       {{"frobnicate"}, 2, "unknown command frobnicate"},
       {{}, 2, "give a command"},
       {{"start", "--port", "70000"}, 2, "bad port 70000"},
       {{"config", "--password", "x"}, 2, "visible to every user"},
       {{"status", "--no-such-option"}, 2, "unknown or incomplete option"},
       {{"--version"}, 0, "s2s-server "},
       {{"--help"}, 0, "ssh-setup --user USER --key-file FILE"}});

  // Shares added at once all arrive: each change waits for the last.
  std::vector<Child> adds;
  for (int i = 0; i < 6; ++i) {
    adds.push_back(
        s2s_test::Spawn(tmp.path(), {S2S_SERVER_PROGRAM, "--root", root,
                                     "share", "add", "p" + std::to_string(i)}));
  }
  for (Child& c : adds) EXPECT_EQ(0, c.Wait()) << c.err;
  const std::string daemon_conf = ReadFile(root + "/etc/s2s/rsyncd.conf");
  for (int i = 0; i < 6; ++i) {
    EXPECT_TRUE(Has(daemon_conf, "[p" + std::to_string(i) + "]")) << i;
  }

  // The old line of the same key was replaced, the other key kept.
  const std::string conf = root + "/etc/s2s/rsyncd-ssh.conf";
  EXPECT_EQ(
      "ssh-rsa OTHER other@host\nrestrict,command=\"rsync --server "
      "--daemon --config=" +
          conf + " .\" ssh-ed25519 " + blob + "\n",
      ReadFile(keys));
  // Files only the user reads, and the added share handed to the user.
  for (const std::string& path :
       {keys, root + "/etc/s2s/rsyncd-ssh.secrets", root + "/volume1/extra"}) {
    struct stat st;
    ASSERT_EQ(0, stat(path.c_str(), &st)) << path;
    EXPECT_EQ(nobody->pw_uid, st.st_uid) << path;
    EXPECT_EQ(S_ISDIR(st.st_mode) ? 0755u : 0600u, st.st_mode & 07777) << path;
  }
  EXPECT_EQ("nobody:pw-ssh-admin\n",
            ReadFile(root + "/etc/s2s/rsyncd-ssh.secrets"));

  // The key's forced command as the user, rsync's shell standing in for SSH.
  const std::string shell = tmp.Sub("login"), command = tmp.Sub("command");
  ASSERT_TRUE(s2s_test::WriteScript(
      shell, "exec setpriv --reuid=" + std::to_string(nobody->pw_uid) +
                 " --regid=" + std::to_string(nobody->pw_gid) +
                 " --clear-groups rsync --server --daemon --config=" + conf +
                 " .\n"));
  ASSERT_TRUE(
      s2s_test::WriteFile(command,
                          "command=\"S2S_GetProtocolVer\"\nclientID=\"C1\"\n"
                          "outfile=\"/v\"\nrequestID=\"r1\"\n"));
  Child pull = s2s_test::RunProgram(
      tmp.path(), {"rsync", "-e", shell, "--password-file", pw, "--early-input",
                   command, "nobody@localhost::s2scmd/r1", tmp.path() + "/"});
  EXPECT_EQ(0, pull.code) << pull.out << pull.err;
  EXPECT_EQ("status=0\n1", ReadFile(tmp.Sub("r1")).substr(0, 10));

  // Another live process behind the pid file: stop neither signals nor forgets.
  Child sleeper = s2s_test::Spawn(tmp.path(), {"/bin/sleep", "30"});
  const std::string pid = root + "/var/run/s2s-rsyncd.pid",
                    port = root + "/var/run/s2s-rsyncd.port";
  s2s_test::WriteFile(pid, std::to_string(sleeper.pid) + "\n");
  s2s_test::WriteFile(port, "873\n");
  RunCases(tmp, root, {{{"stop"}, 1, "not signalled"}});
  EXPECT_EQ(0, kill(sleeper.pid, 0)) << "the foreign process was signalled";
  EXPECT_EQ(std::to_string(sleeper.pid) + "\n873\n",
            ReadFile(pid) + ReadFile(port));
  kill(sleeper.pid, SIGKILL);
  sleeper.Wait();
  EXPECT_EQ(2, s2s_test::RunProgram(tmp.path(), {S2S_SERVER_PROGRAM, "status"},
                                    {"S2S_ROOT"})
                   .code)
      << "no root given";
}

}  // namespace
