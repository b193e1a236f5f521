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

// The daemon's user is also the SSH login of the key-file transfer, so it is
// whoever runs the tests.
std::string LoginName() {
  const passwd* pw = getpwuid(geteuid());
  return pw != nullptr ? pw->pw_name : "root";
}

}  // namespace

Appliances::Appliances(const std::string& handler)
    : client_root_(dir_.Sub("client")),
      server_root_(dir_.Sub("server")),
      handler_(handler),
      user_(LoginName()),
      password_("appliance-Pw-5e1d"),
      daemon_(dir_.path()) {
  WriteClient(client_root_, "CLIENT-A", "client-a");
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
  std::string dir = encrypted ? "/data/@" + name + "@" : "/data/" + name;
  bool ok =
      MakeDirs(server_root_ + dir) &&
      WriteFile(server_root_ + "/etc/s2s/shares.conf", ShareConf(server_root_));
  for (const std::string& root : clients_) {
    ok = ok && MakeDirs(root + dir) && MakeDirs(root + "/data/" + name) &&
         WriteFile(root + "/etc/s2s/shares.conf", ShareConf(root));
  }
  return ok && MakeDirs(client_root_ + dir) &&
         MakeDirs(client_root_ + "/data/" + name) &&
         WriteFile(client_root_ + "/etc/s2s/shares.conf",
                   ShareConf(client_root_));
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
    // The generator writes below the root it runs under.
    ScopedEnv server("S2S_ROOT", server_root_);
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
  clients_.push_back(root);
  WriteClient(root, serial, "client-" + serial);
  for (const Share& s : shares_) {
    MakeDirs(root + "/data/" + s.name);
    if (s.encrypted) MakeDirs(root + "/data/@" + s.name + "@");
  }
  return root;
}

void Appliances::Enter(const std::string& root) {
  root_env_.reset();
  root_env_.reset(new ScopedEnv("S2S_ROOT", root));
}

std::string Appliances::ClientShare(const std::string& name) const {
  for (const Share& s : shares_) {
    if (s.name == name && s.encrypted) {
      return client_root_ + "/data/@" + name + "@";
    }
  }
  return client_root_ + "/data/" + name;
}

std::string Appliances::ServerShare(const std::string& name) const {
  for (const Share& s : shares_) {
    if (s.name == name && s.encrypted) {
      return server_root_ + "/data/@" + name + "@";
    }
  }
  return server_root_ + "/data/" + name;
}

std::string Appliances::ClientKeyFile(const std::string& name) const {
  return client_root_ + "/keys/" + name + ".key";
}

std::string Appliances::ServerKeyDir() const {
  return server_root_ + "/usr/karo/etc/.encrypt";
}

S2S::SyncInfo Appliances::Info() const {
  S2S::SyncInfo info;
  info.SetServerIP("127.0.0.1");
  info.SetUser(user_);
  info.SetPassword(password_);
  return info;
}

}  // namespace s2s_test
