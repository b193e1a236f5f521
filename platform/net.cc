#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netpacket/packet.h>
#include <string.h>
#include <strings.h>

#include <algorithm>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "karo_err.h"
#include "karo_host.h"
#include "karo_net.h"
#include "karo_root.h"

namespace {

bool AllZero(const unsigned char* mac) {
  return std::all_of(mac, mac + 6, [](unsigned char b) { return b == 0; });
}

// Appends `addr` unless it is already there or the table is full.
void AddAddress(std::vector<std::string>* out, const std::string& addr,
                int max) {
  if (static_cast<int>(out->size()) >= max) return;
  if (std::find(out->begin(), out->end(), addr) == out->end()) {
    out->push_back(addr);
  }
}

// The IPv4 addresses the root's hosts file gives `host`. Only a non-empty
// root has a hosts file of its own: the real one is the resolver's.
void LookupRootHosts(const char* host, int max, std::vector<std::string>* out) {
  if (*KaroRootPrefix() == '\0') return;
  std::ifstream in(KaroRootPath("/etc/hosts"));
  std::string line;
  while (std::getline(in, line)) {
    line = line.substr(0, line.find('#'));
    std::istringstream fields(line);
    std::string addr, name;
    in_addr parsed;
    if (!(fields >> addr) || inet_pton(AF_INET, addr.c_str(), &parsed) != 1) {
      continue;
    }
    while (fields >> name) {
      if (strcasecmp(name.c_str(), host) == 0) {
        AddAddress(out, addr, max);
        break;
      }
    }
  }
}

// Returns 0 (with `out` possibly still empty) or -1 when the resolver fails.
int LookupResolver(const char* host, int max, std::vector<std::string>* out) {
  addrinfo hints{};
  hints.ai_family = AF_INET;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* res = nullptr;
  int rc = getaddrinfo(host, nullptr, &hints, &res);
  if (rc == EAI_NONAME || rc == EAI_NODATA || rc == EAI_AGAIN ||
      rc == EAI_FAIL) {
    return 0;  // an unknown name is an answer, not a failure
  }
  if (rc != 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  for (addrinfo* ai = res; ai != nullptr; ai = ai->ai_next) {
    char text[INET_ADDRSTRLEN];
    const auto* sin = reinterpret_cast<const sockaddr_in*>(ai->ai_addr);
    if (inet_ntop(AF_INET, &sin->sin_addr, text, sizeof text) != nullptr) {
      AddAddress(out, text, max);
    }
  }
  freeaddrinfo(res);
  return 0;
}

}  // namespace

extern "C" int KLIBNetGetInterfaceInfo(KARO_NETIF* info, int max, int flags) {
  if (info == nullptr || max < 1 || (flags & ~KARO_NETIF_SKIP_LOOPBACK) != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  std::vector<KARO_NETIF> found;
  for (ifaddrs* ifa = list; ifa != nullptr; ifa = ifa->ifa_next) {
    if (ifa->ifa_addr == nullptr || ifa->ifa_addr->sa_family != AF_PACKET) {
      continue;
    }
    if ((flags & KARO_NETIF_SKIP_LOOPBACK) && (ifa->ifa_flags & IFF_LOOPBACK)) {
      continue;
    }
    const auto* ll = reinterpret_cast<const sockaddr_ll*>(ifa->ifa_addr);
    if (ll->sll_halen != 6 || AllZero(ll->sll_addr)) continue;
    KARO_NETIF rec{};
    snprintf(rec.name, sizeof rec.name, "%s", ifa->ifa_name);
    rec.index = ll->sll_ifindex;
    memcpy(rec.mac, ll->sll_addr, 6);
    found.push_back(rec);
  }
  freeifaddrs(list);
  std::stable_sort(found.begin(), found.end(),
                   [](const KARO_NETIF& a, const KARO_NETIF& b) {
                     return a.index < b.index;
                   });
  int n = std::min(max, static_cast<int>(found.size()));
  std::copy(found.begin(), found.begin() + n, info);
  return n;
}

extern "C" int KARONetLookupIP(const char* host, KARO_IPADDR* table, int max,
                               int flags) {
  if (host == nullptr || *host == '\0' || table == nullptr || max < 1 ||
      flags != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::vector<std::string> found;
  LookupRootHosts(host, max, &found);
  if (found.empty()) {
    char lookup[16];
    bool hosts_only =
        KaroPlatformConfGet("lookup", lookup, sizeof lookup) >= 0 &&
        strcasecmp(lookup, "hosts") == 0;
    if (!hosts_only && LookupResolver(host, max, &found) < 0) return -1;
  }
  for (size_t i = 0; i < found.size(); ++i) {
    snprintf(table[i].addr, sizeof table[i].addr, "%s", found[i].c_str());
  }
  return static_cast<int>(found.size());
}
