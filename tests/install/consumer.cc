// Uses the installed headers and library the way a host program would.
#include <S2S/S2S.h>

#include <cstdio>
#include <cstring>

int main(int argc, char** argv) {
  // "service": the platform's client service, started from the programs of
  // the prefix this library was installed to.
  if (argc == 2 && std::strcmp(argv[1], "service") == 0) {
    if (S2S::StartDaemon() != 0 || !S2S::IsDaemonRunning()) return 1;
    if (S2S::StopDaemon() != 0 || S2S::IsDaemonRunning()) return 1;
    std::puts("consumer service ok");
    return 0;
  }
  S2S::PObject msg;
  msg["name"] = "task";
  msg["id"] = 7u;
  if (msg.toString() != "{\"id\": 7, \"name\": \"task\"}") return 1;
  if (std::string(S2S::ResultMessage(-5)) != "Protocal error") return 1;
  // The Rsyncer's tasks derive from the rsync wrapper: libkarorsync must come
  // along with libs2s.
  S2S::Rsyncer rsyncer;
  std::list<std::string> parts;
  S2S::Rsyncer::SplitStringByChars("a:b", ":", parts);
  if (parts.size() != 2 || rsyncer.SupportMultiSource()) return 1;
  if (S2S::Logger::Initialize(S2S::Logger::Stdout, 3, "", 0) != 0) return 1;
  std::puts("consumer ok");
  return 0;
}
