#include "root_files.h"

#include <filesystem>
#include <memory>

#include "karo_section.h"

namespace s2s_tools {

bool MakeDirs(const std::string& dir, std::string& error) {
  std::error_code ec;
  std::filesystem::create_directories(dir, ec);
  if (ec) error = "cannot create " + dir + ": " + ec.message();
  return !ec;
}

bool AddSection(const std::string& file, const std::string& section,
                const Pairs& kv, std::string& error) {
  Hash h(KLIBCSzHashAlloc(16));
  bool ok = h != nullptr;
  for (const auto& p : kv) {
    ok = ok &&
         KLIBCSzHashSetValue(h.get(), p.first.c_str(), p.second.c_str()) == 0;
  }
  if (!ok || KLIBCFileAddSection(file.c_str(), section.c_str(), h.get(),
                                 nullptr) < 0) {
    error = "cannot write section [" + section + "] of " + file;
    return false;
  }
  return true;
}

bool MergeSection(const std::string& file, const std::string& section,
                  const Pairs& kv, std::string& error) {
  Hash h(KLIBCSzHashAlloc(64));
  Pairs merged;
  if (h != nullptr && KLIBCFileExist(file.c_str()) &&
      KLIBCFileGetSection(file.c_str(), section.c_str(), h.get()) < 0) {
    error = "cannot read section [" + section + "] of " + file;
    return false;
  }
  for (int i = 0; h != nullptr && i < KLIBCSzHashCount(h.get()); ++i) {
    merged.emplace_back(KLIBCSzHashKeyAt(h.get(), i),
                        KLIBCSzHashValueAt(h.get(), i));
  }
  for (const auto& p : kv) {
    bool set = false;
    for (auto& m : merged) {
      if (m.first == p.first) {
        m.second = p.second;
        set = true;
      }
    }
    if (!set) merged.push_back(p);
  }
  return AddSection(file, section, merged, error);
}

}  // namespace s2s_tools
