#include "appliances.h"

#include <pwd.h>
#include <unistd.h>

#include <filesystem>

#include "daemon_config.h"

namespace s2s_test {

namespace {

bool MakeDirs(const std::string& path) {
  std::error_code ec;
  std::filesystem::create_directories(path, ec);
  return !ec;
}

// The daemon's user, also the key transfer's SSH login: whoever runs tests.
std::string LoginName() {
  const passwd* pw = getpwuid(geteuid());
  return pw != nullptr ? pw->pw_name : "root";
}

// The early hook answers the command of the early input (or the upload its
// request id names) from status/<name> and answer/<name> (grown with a hole to
// the size in pad/<name>), keeps it in last/<name> and counts it in log.
const char kScriptedHook[] = R"SH(
dir=$(dirname "$0")
cmd="$dir/spool/$$"
cat > "$cmd"
id=$(sed -n 's/^requestID="\([0-9a-f]*\)"$/\1/p' "$cmd")
[ -n "$id" ] || exit 1
grep -q '^command=' "$cmd" || cp "$dir/upload/$id" "$cmd"
name=$(sed -n 's/^command="\([A-Za-z0-9_]*\)"$/\1/p' "$cmd")
[ -n "$name" ] || exit 1
mv "$cmd" "$dir/last/$name"
echo "$name" >> "$dir/log"
status=$(cat "$dir/status/$name" 2>/dev/null || echo 0)
{ echo "status=$status"; cat "$dir/answer/$name" 2>/dev/null || :; } \
  > "$dir/reply/$id"
[ ! -s "$dir/pad/$name" ] || truncate -s "$(cat "$dir/pad/$name")" \
  "$dir/reply/$id"
)SH";

}  // namespace

Appliances::Appliances(const std::string& handler)
    : client_root_(dir_.Sub("client")),
      server_root_(dir_.Sub("server")),
      handler_(handler),
      user_(LoginName()),
      password_("appliance-Pw-5e1d"),
      daemon_(dir_.path()) {
  WriteClient(client_root_, "CLIENT-A", "client-a");
  roots_ = {server_root_, client_root_};
  MakeDirs(server_root_ + "/etc/s2s");
  WriteFile(server_root_ + "/etc/s2s/platform.conf",
            "[Platform]\n\tserial=\"SERVER-1\"\n\thostname=\"server\"\n");
  Enter(client_root_);
}

Appliances::~Appliances() { StopServer(); }

bool Appliances::WriteClient(const std::string& root, const std::string& serial,
                             const std::string& hostname) {
  return MakeDirs(root + "/etc/s2s") && MakeDirs(root + "/tmp/S2S") &&
         MakeDirs(root + "/keys") &&
         WriteFile(root + "/etc/s2s/platform.conf",
                   "[Platform]\n\tserial=\"" + serial + "\"\n\thostname=\"" +
                       hostname + "\"\n\tlookup=\"hosts\"\n") &&
         WriteFile(root + "/etc/hosts", "127.0.0.1 localhost\n") &&
         WriteFile(root + "/etc/s2s/shares.conf", ShareConf(root));
}

std::string Appliances::ShareConf(const std::string& root) const {
  std::string conf;
  for (const Share& s : shares_) {
    conf += "[" + s.name + "]\n\tpath=\"" + root + "/data/" + s.name +
            "\"\n\tvolume=\"/volume1\"\n\tvolume_type=\"1\"\n\tacl=\"yes\"\n";
    if (s.encrypted) {
      conf += "\tencrypted=\"yes\"\n\tkey_length=\"32\"\n\tenc_path=\"" + root +
              "/data/@" + s.name + "@\"\n\tkey_file=\"" + root + "/keys/" +
              s.name + ".key\"\n";
    }
  }
  return conf;
}

bool Appliances::AddShare(const std::string& name, bool encrypted) {
  shares_.push_back({name, encrypted});
  bool ok = true;
  for (const std::string& root : roots_) {
    ok = ok && MakeShareDirs(root, name) &&
         WriteFile(root + "/etc/s2s/shares.conf", ShareConf(root));
  }
  return ok;
}

// The share's directory, and for an encrypted share its lower one too.
bool Appliances::MakeShareDirs(const std::string& root,
                               const std::string& name) const {
  return MakeDirs(root + "/data/" + name) && MakeDirs(ShareDir(root, name));
}

bool Appliances::StartServer(bool old_server) {
  S2S::server::DaemonConfig config;
  config.handler = handler_;
  config.user = user_;
  config.password = password_;
  config.uid = geteuid();
  config.gid = getegid();
  config.old_server = old_server;
  {
    // The generator writes below its root; hooks run through the handler.
    ScopedEnv server("S2S_ROOT", server_root_);
    ScopedEnv shell("RSYNC_SHELL", handler_);
    if (S2S::server::WriteDaemonConfig(config) != 0 ||
        !daemon_.StartWithConfig(S2S::server::DaemonConfigPath())) {
      return false;
    }
  }
  port_env_.reset();
  port_env_.reset(
      new ScopedEnv("S2S_RSYNC_PORT", std::to_string(daemon_.port())));
  return true;
}

void Appliances::StopServer() {
  daemon_.Stop();
  port_env_.reset();
}

std::string Appliances::AddClient(const std::string& serial) {
  std::string root = dir_.Sub("client-" + serial);
  roots_.push_back(root);
  WriteClient(root, serial, "client-" + serial);
  for (const Share& s : shares_) MakeShareDirs(root, s.name);
  return root;
}

void Appliances::Enter(const std::string& root) {
  root_env_.reset();
  root_env_.reset(new ScopedEnv("S2S_ROOT", root));
}

std::string Appliances::ShareDir(const std::string& root,
                                 const std::string& name) const {
  for (const Share& s : shares_) {
    if (s.name == name && s.encrypted) return root + "/data/@" + name + "@";
  }
  return root + "/data/" + name;
}

std::string Appliances::ServerRegistry(const std::string& section,
                                       const std::string& key) {
  ScopedEnv server("S2S_ROOT", server_root_);
  return RegistryValue(section, key);
}

S2S::SyncInfo Appliances::Info() const {
  S2S::SyncInfo info;
  info.SetServerIP("127.0.0.1");
  info.SetUser(user_);
  info.SetPassword(password_);
  return info;
}

ScriptedServer::ScriptedServer(const std::string& dir)
    : dir_(dir), daemon_(dir) {}

bool ScriptedServer::Start(const std::string& user,
                           const std::string& password) {
  for (const char* d :
       {"spool", "upload", "reply", "last", "status", "answer", "pad"}) {
    if (!MakeDirs(dir_ + "/" + d)) return false;
  }
  std::string hook = dir_ + "/hook.sh", secrets = dir_ + "/rsyncd.secrets";
  std::string auth =
      "\tauth users = " + user + "\n\tsecrets file = " + secrets + "\n";
  std::string conf = "use chroot = no\nsocket options = TCP_NODELAY\nuid = " +
                     std::to_string(geteuid()) +
                     "\ngid = " + std::to_string(getegid()) +
                     "\n[s2scmd]\n\tpath = " + dir_ + "/reply\n" + auth +
                     "\tread only = yes\n\tearly exec = " + hook +
                     "\n[s2sspool]\n\tpath = " + dir_ + "/upload\n" + auth +
                     "\tread only = no\n\twrite only = yes\n";
  if (!WriteScript(hook, kScriptedHook) ||
      !WriteFile(secrets, user + ":" + password + "\n", 0600) ||
      !WriteFile(dir_ + "/rsyncd.conf", conf) ||
      !daemon_.StartWithConfig(dir_ + "/rsyncd.conf")) {
    return false;
  }
  port_env_.reset();
  port_env_.reset(
      new ScopedEnv("S2S_RSYNC_PORT", std::to_string(daemon_.port())));
  return true;
}

void ScriptedServer::Answer(const std::string& command, int status,
                            const std::string& answer) {
  WriteFile(dir_ + "/status/" + command, std::to_string(status) + "\n");
  WriteFile(dir_ + "/answer/" + command, answer);
}

void ScriptedServer::PadReply(const std::string& command,
                              unsigned long long size) {
  WriteFile(dir_ + "/pad/" + command, std::to_string(size) + "\n");
}

std::string ScriptedServer::LastRequest(const std::string& command) const {
  return ReadFile(dir_ + "/last/" + command);
}

int ScriptedServer::Count() const {
  std::string log = ReadFile(dir_ + "/log");
  int n = 0;
  for (char c : log) n += c == '\n';
  return n;
}

}  // namespace s2s_test
