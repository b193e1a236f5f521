#include "client_root.h"

#include <getopt.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "karo_root.h"
#include "karo_share.h"
#include "root_files.h"
#include "server_root.h"

namespace s2s_tools {

namespace {

enum Option { kRoot = 256, kShare, kSerial, kHostname };

const struct option kOptions[] = {
    {"root", required_argument, nullptr, kRoot},
    {"share", required_argument, nullptr, kShare},
    {"serial", required_argument, nullptr, kSerial},
    {"hostname", required_argument, nullptr, kHostname},
    {"help", no_argument, nullptr, 'h'},
    {nullptr, 0, nullptr, 0},
};

const char kUsage[] =
    "usage: s2s-client [--root DIR] init --share NAME[=PATH]...\n"
    "                  [--serial SERIAL] [--hostname NAME]\n"
    "\n"
    "Adds the shares to the client root's share configuration (default path\n"
    "<root>/volume1/NAME; the directory is created when missing) and, with\n"
    "--serial or --hostname, writes the root's identity.\n";

int Usage(const std::string& error) {
  fprintf(stderr, "s2s-client: init: %s\n(try init --help)\n", error.c_str());
  return 2;
}

int Fail(const std::string& error) {
  fprintf(stderr, "s2s-client: init: %s\n", error.c_str());
  return 1;
}

// The volume of `path` as the mount table has it: "/NAME".
std::string MountVolume(const std::string& path) {
  KARO_VOLUME volume;
  if (VolumePathParseEx(path.c_str(), &volume) != 0) return "";
  return volume.path;
}

}  // namespace

bool IsClientInit(int argc, char** argv) {
  if (argc > 1 && strcmp(argv[1], "init") == 0) return true;
  if (argc > 2 && strncmp(argv[1], "--root=", 7) == 0) {
    return strcmp(argv[2], "init") == 0;
  }
  return argc > 3 && strcmp(argv[1], "--root") == 0 &&
         strcmp(argv[3], "init") == 0;
}

int RunClientInit(int argc, char** argv) {
  std::vector<ShareSpec> shares;
  Pairs identity;
  optind = 0;
  opterr = 0;
  int c;
  ShareSpec share;
  while ((c = getopt_long(argc, argv, "h", kOptions, nullptr)) != -1) {
    switch (c) {
      case kRoot:
        setenv(KARO_ROOT_ENV, optarg, 1);
        break;
      case kShare:
        if (!ParseShareSpec(optarg, share)) {
          return Usage(std::string("bad share ") + optarg);
        }
        shares.push_back(share);
        break;
      case kSerial:
        identity.emplace_back("serial", optarg);
        break;
      case kHostname:
        identity.emplace_back("hostname", optarg);
        break;
      case 'h':
        fputs(kUsage, stdout);
        return 0;
      default:
        return Usage(std::string("unknown or incomplete option ") +
                     argv[optind - 1]);
    }
  }
  if (optind + 1 != argc || strcmp(argv[optind], "init") != 0) {
    return Usage("give the command init once, and options only");
  }
  if (shares.empty() && identity.empty())
    return Usage("give --share NAME=PATH");
  std::string error;
  if (!MakeDirs(KaroRootPath("/etc/s2s"), error)) return Fail(error);
  if (!identity.empty() && !MergeSection(KaroRootPath("/etc/s2s/platform.conf"),
                                         "Platform", identity, error)) {
    return Fail(error);
  }
  for (const ShareSpec& s : shares) {
    std::string path =
        s.path.empty() ? KaroRootPath("/volume1/" + s.name) : s.path;
    if (!MakeDirs(path, error)) return Fail(error);
    std::string volume = MountVolume(path);
    if (volume.empty()) return Fail("no mount holds " + path);
    if (!AddSection(KaroRootPath(KARO_SHARE_CONF), s.name,
                    {{"path", path}, {"volume", volume}}, error)) {
      return Fail(error);
    }
    printf("init: share %s at %s, volume %s\n", s.name.c_str(), path.c_str(),
           volume.c_str() + 1);
  }
  printf("init: client root %s ready\n",
         *KaroRootPrefix() != '\0' ? KaroRootPrefix() : "/");
  return 0;
}

}  // namespace s2s_tools
