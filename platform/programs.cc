#include <dlfcn.h>
#include <limits.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "karo_err.h"
#include "karo_programs.h"

namespace {

// The installed subdirectories, relative to the prefix (set by the build).
const char* const kInstallDirs[] = {KARO_INSTALL_LIBDIR, KARO_INSTALL_BINDIR,
                                    KARO_INSTALL_SBINDIR,
                                    KARO_INSTALL_LIBEXECDIR "/s2s"};
const char* const kProgramDirs[] = {KARO_INSTALL_BINDIR, KARO_INSTALL_SBINDIR,
                                    KARO_INSTALL_LIBEXECDIR "/s2s"};

std::string DirOf(const std::string& file) {
  size_t slash = file.rfind('/');
  return slash == std::string::npos || slash == 0 ? "" : file.substr(0, slash);
}

// The directory of the shared object (or program) holding this code.
std::string ModuleDir() {
  Dl_info info;
  if (dladdr(reinterpret_cast<void*>(&KaroProgramFind), &info) == 0 ||
      info.dli_fname == nullptr) {
    return "";
  }
  char real[PATH_MAX];
  if (realpath(info.dli_fname, real) == nullptr) return "";
  return DirOf(real);
}

std::string ExeDir() {
  char self[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
  return n <= 0 ? "" : DirOf(std::string(self, static_cast<size_t>(n)));
}

bool EndsWith(const std::string& s, const std::string& tail) {
  return s.size() > tail.size() &&
         s.compare(s.size() - tail.size(), tail.size(), tail) == 0 &&
         s[s.size() - tail.size() - 1] == '/';
}

// Candidate paths of `name` relative to `dir`, in search order.
void AddCandidates(const std::string& dir, const std::string& name,
                   std::vector<std::string>& out) {
  if (dir.empty()) return;
  out.push_back(dir + "/" + name);
  for (const char* sub : kInstallDirs) {
    if (sub[0] == '/' || !EndsWith(dir, sub)) continue;
    std::string prefix = dir.substr(0, dir.size() - strlen(sub) - 1);
    for (const char* bin : kProgramDirs) {
      out.push_back(prefix + "/" + bin + "/" + name);
    }
    return;
  }
}

}  // namespace

extern "C" int KaroProgramFind(const char* name, char* out, size_t size) {
  if (name == nullptr || *name == '\0' || strchr(name, '/') != nullptr ||
      out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::vector<std::string> candidates;
  AddCandidates(ModuleDir(), name, candidates);
  AddCandidates(ExeDir(), name, candidates);
  for (const std::string& path : candidates) {
    if (access(path.c_str(), X_OK) != 0) continue;
    if (path.size() + 1 > size) {
      KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
      return -1;
    }
    memcpy(out, path.c_str(), path.size() + 1);
    return 0;
  }
  KLIBCErrSet(KERR_NOT_FOUND);
  return -1;
}

std::string KaroProgramPath(const std::string& name) {
  char buf[PATH_MAX];
  return KaroProgramFind(name.c_str(), buf, sizeof buf) == 0 ? buf : "";
}
