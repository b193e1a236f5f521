#include "S2S/s2s_address.h"

#include <stdio.h>
#include <strings.h>

#include <string>
#include <vector>

#include "karo_net.h"
#include "karo_process.h"

#define S2S_LOG_AREA "s2s"
#include "S2S/log.h"

namespace S2S {

namespace {

const int kMaxAddresses = 20;

// The NetBIOS name the machine at `ip` gives for itself, or "" when it gives
// none.
std::string NetbiosName(const std::string& ip) {
  FILE* pipe = KLIBCPopen("nmblookup", "r", "-A", ip.c_str(),
                          static_cast<const char*>(nullptr));
  if (pipe == nullptr) {
    LOG_ERROR("nmblookup_r: popen error");
    return std::string();
  }
  std::string name;
  char line[128];
  while (fgets(line, sizeof line, pipe) != nullptr) {
    char word[17] = {0};
    if (line[0] == '\t' && sscanf(line + 1, "%16s#", word) == 1) {
      name = word;
      break;
    }
  }
  KLIBCPclose(pipe);
  return name;
}

// Resolves `host`: the count of KARONetLookupIP, the addresses in `found`.
int Resolve(const std::string& host, std::vector<std::string>& found) {
  KARO_IPADDR table[kMaxAddresses];
  int count = KARONetLookupIP(host.c_str(), table, kMaxAddresses, 0);
  for (int i = 0; i < count; ++i) found.push_back(table[i].addr);
  return count;
}

}  // namespace

int GetUsableIP(const std::string& host, const std::string& ip,
                std::vector<std::string>& out) {
  if (host.empty()) {
    out.push_back(ip);
    return 0;
  }
  std::vector<std::string> found;
  if (ip.empty()) {
    if (Resolve(host, found) < 1) return -1;
    out.insert(out.end(), found.begin(), found.end());
    return 0;
  }
  if (strcasecmp(NetbiosName(ip).c_str(), host.c_str()) == 0) {
    out.push_back(ip);
    return 0;
  }
  int count = Resolve(host, found);
  if (count < 0) return -1;
  for (const std::string& addr : found) {
    if (strcasecmp(addr.c_str(), ip.c_str()) == 0) {
      out.push_back(ip);
      return 0;
    }
  }
  if (count == 0) {
    out.push_back(ip);
    return 0;
  }
  out.insert(out.end(), found.begin(), found.end());
  return 0;
}

}  // namespace S2S
