// Setting up a client appliance root: its shares and, when asked, its
// identity, so that no configuration file is written by hand.
//
//   s2s-client [--root DIR] init --share NAME[=PATH]... [--serial SERIAL]
//              [--hostname NAME]
#ifndef S2S_TOOLS_CLIENT_ROOT_H_
#define S2S_TOOLS_CLIENT_ROOT_H_

namespace s2s_tools {

// True when `argv` asks for "init" (as its first word, or after --root).
bool IsClientInit(int argc, char** argv);

// Runs "init": adds each share to /etc/s2s/shares.conf under the root (a
// share already there is replaced), its directory created when missing
// (default <root>/volume1/NAME), on the volume named after the mount that
// holds it ("root" for the root file system); with --serial or --hostname
// writes /etc/s2s/platform.conf. Prints what it did. Returns the exit code:
// 0 done, 1 failed, 2 usage.
int RunClientInit(int argc, char** argv);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CLIENT_ROOT_H_
