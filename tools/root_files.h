// Writing the configuration files of an appliance root: directories and
// sections of the platform's section files.
#ifndef S2S_TOOLS_ROOT_FILES_H_
#define S2S_TOOLS_ROOT_FILES_H_

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "karo_section.h"

namespace s2s_tools {

// Owners of the platform's string lists and hashes.
struct ListFree {
  void operator()(KSZLIST* l) const { KLIBCSzListFree(l); }
};
struct HashFree {
  void operator()(KSZHASH* h) const { KLIBCSzHashFree(h); }
};
using List = std::unique_ptr<KSZLIST, ListFree>;
using Hash = std::unique_ptr<KSZHASH, HashFree>;

using Pairs = std::vector<std::pair<std::string, std::string>>;

// Creates `dir` and its missing parents. True, or false with `error`.
bool MakeDirs(const std::string& dir, std::string& error);

// Writes section `section` of the section file `file` with the pairs `kv`
// (replacing a section of that name). True, or false with `error`.
bool AddSection(const std::string& file, const std::string& section,
                const Pairs& kv, std::string& error);

// As AddSection, but keeps the section's keys that `kv` does not set.
bool MergeSection(const std::string& file, const std::string& section,
                  const Pairs& kv, std::string& error);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_ROOT_FILES_H_
