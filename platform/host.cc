#include <string.h>
#include <strings.h>
#include <unistd.h>

#include <string>

#include "karo_err.h"
#include "karo_host.h"
#include "karo_root.h"
#include "karo_section.h"

namespace {

// The machine's own stable identifier. Deliberately not under the root: a
// test root that wants an identity of its own sets "serial".
const char kMachineIdFile[] = "/etc/machine-id";

// Copies `value` whole into `buf` or leaves `buf` empty.
int CopyWhole(const std::string& value, char* buf, int size) {
  if (value.size() + 1 > static_cast<size_t>(size)) {
    buf[0] = '\0';
    KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
    return -1;
  }
  memcpy(buf, value.c_str(), value.size() + 1);
  return static_cast<int>(value.size());
}

// The configuration value of `key`, or nothing when the file or key is absent.
bool ConfValue(const char* key, std::string* value) {
  char buf[4096];
  if (KaroPlatformConfGet(key, buf, sizeof buf) < 0) return false;
  *value = buf;
  return true;
}

std::string MachineId() {
  FILE* f = fopen(kMachineIdFile, "re");
  if (f == nullptr) return std::string();
  char buf[128] = {0};
  if (fgets(buf, sizeof buf, f) == nullptr) buf[0] = '\0';
  fclose(f);
  buf[strcspn(buf, "\r\n \t")] = '\0';
  return buf;
}

}  // namespace

extern "C" int KaroPlatformConfGet(const char* key, char* buf, int size) {
  std::string file = KaroRootPath(KARO_PLATFORM_CONF);
  return KLIBCFileGetSectionValue(file.c_str(), KARO_PLATFORM_SECTION, key, buf,
                                  size);
}

extern "C" int KaroPlatformConfIsYes(const char* key) {
  char buf[16];
  return KaroPlatformConfGet(key, buf, sizeof buf) >= 0 &&
         strcasecmp(buf, "yes") == 0;
}

extern "C" int KAROLnxGetHostname(char* buf, int size) {
  if (buf == nullptr || size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string name;
  if (!ConfValue("hostname", &name) || name.empty()) {
    char sys[256] = {0};
    if (gethostname(sys, sizeof sys - 1) != 0) {
      KLIBCErrSet(KERR_SYSTEM);
      return -1;
    }
    name = sys;
  }
  size_t n = name.size() < static_cast<size_t>(size)
                 ? name.size() + 1
                 : static_cast<size_t>(size);
  memcpy(buf, name.c_str(), n);
  return 0;
}

extern "C" int KLIBGetSerialNumber(char* buf, int size) {
  if (buf == nullptr || size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string serial;
  if (!ConfValue("serial", &serial)) serial = MachineId();
  return CopyWhole(serial, buf, size);
}

extern "C" int KAROHAIsRunning(void) { return KaroPlatformConfIsYes("ha"); }

extern "C" int KAROHAGetMac(int index, char* buf, int size) {
  if (buf == nullptr || size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string mac;
  if (index != 0 || !ConfValue("ha_mac", &mac) || mac.empty()) {
    buf[0] = '\0';
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  return CopyWhole(mac, buf, size);
}

extern "C" int KLIBCIsPlugUnit(void) {
  return KaroPlatformConfIsYes("plug_unit");
}
