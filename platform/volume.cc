#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "karo_err.h"
#include "karo_root.h"
#include "karo_share.h"
#include "share_conf.h"

namespace {

// Undoes the octal escapes (\040 for a blank, ...) of the mount table.
std::string Unescape(const char* field) {
  std::string out;
  for (const char* p = field; *p != '\0'; ++p) {
    if (p[0] == '\\' && p[1] >= '0' && p[1] <= '7' && p[2] >= '0' &&
        p[2] <= '7' && p[3] >= '0' && p[3] <= '7') {
      out += static_cast<char>((p[1] - '0') * 64 + (p[2] - '0') * 8 +
                               (p[3] - '0'));
      p += 3;
    } else {
      out += *p;
    }
  }
  return out;
}

// True when `mount` is `path` or one of its ancestors, component-wise.
bool Holds(const std::string& mount, const std::string& path) {
  if (mount == "/") return true;
  return path.compare(0, mount.size(), mount) == 0 &&
         (path.size() == mount.size() || path[mount.size()] == '/');
}

FILE* OpenMountTable() {
  FILE* f = fopen(KaroRootPath("/etc/mtab").c_str(), "re");
  return f != nullptr ? f : fopen("/proc/self/mounts", "re");
}

int Fill(const std::string& path, int type, KARO_VOLUME* out) {
  if (path.size() + 1 > sizeof out->path) {
    KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
    return -1;
  }
  memcpy(out->path, path.c_str(), path.size() + 1);
  out->type = type;
  return 0;
}

// The deepest mount that holds `path`, as in the mount table, as the
// volume "/NAME" with NAME the mount point's last component ("root" for /).
int FromMountTable(const std::string& path, KARO_VOLUME* out) {
  FILE* table = OpenMountTable();
  if (table == nullptr) {
    KLIBCErrSet(KERR_FILE_NOT_FOUND);
    return -1;
  }
  std::string best;
  int best_type = 0;
  char line[8192];
  while (fgets(line, sizeof line, table) != nullptr) {
    char source[4096], dir[4096];
    if (sscanf(line, "%4095s %4095s", source, dir) != 2) continue;
    std::string mount = Unescape(dir);
    if (!Holds(mount, path) || mount.size() < best.size()) continue;
    best = mount;
    best_type = strncmp(source, "/dev/", 5) == 0 ? KARO_VOLUME_INTERNAL
                                                 : KARO_VOLUME_OTHER;
  }
  fclose(table);
  if (best.empty()) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  // The volume is named after its mount point; the root file system has no
  // name of its own.
  std::string name = best == "/" ? "root" : best.substr(best.rfind('/') + 1);
  return Fill("/" + name, best_type, out);
}

}  // namespace

extern "C" int VolumePathParseEx(const char* path, KARO_VOLUME* out) {
  if (path == nullptr || path[0] != '/' || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  KSZHASH* share = nullptr;
  if (karo_detail::FindShareByPath(p, &share) < 0) return -1;
  const char* volume =
      share == nullptr ? nullptr : KLIBCSzHashGetValue(share, "volume");
  int rc;
  if (volume != nullptr && *volume != '\0') {
    const char* type = KLIBCSzHashGetValue(share, "volume_type");
    rc = Fill(volume, type != nullptr ? atoi(type) : KARO_VOLUME_INTERNAL, out);
  } else {
    rc = FromMountTable(p, out);
  }
  KLIBCSzHashFree(share);
  return rc;
}
