// Internal: a section file held in memory, as the section calls of
// karo_section.h read and write it. Callers that need several sections or
// keys of one file read it once into a SectionDoc and write it back once,
// instead of a section call (a whole parse) per key. Not part of the C API.
//
// Loading is linear in the file's size: sections are indexed by name, and
// keys by section and name, while the file is read. The grammar, the refused
// names and values, and the atomic replace are those of karo_section.h.
#ifndef KARO_SECTION_DOC_H_
#define KARO_SECTION_DOC_H_

#include <stddef.h>

#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "karo_section.h"

namespace karo_detail {

using SectionPairs = std::vector<std::pair<std::string, std::string>>;

class SectionDoc {
 public:
  // Replaces the content with that of `file`. 0, or -1 with the platform
  // error set: KERR_FILE_NOT_FOUND (the content is then empty),
  // KERR_SYSTEM, KERR_FILE_FORMAT.
  int Load(const char* file);

  // Writes the content to `file` through a temporary file that is fsynced
  // and renamed over it (an existing file keeps its mode, a new one gets
  // 0644), then fsyncs the directory. 0, or -1 (KERR_SYSTEM).
  int Store(const char* file) const;

  // The pairs of section `name` in file order, or nullptr when there is no
  // such section.
  const SectionPairs* Find(const std::string& name) const;
  SectionPairs* Find(const std::string& name);

  // The pairs of section `name`, appended empty at the end when missing.
  SectionPairs* Add(const std::string& name);

  // The value of `key` in section `name`, or nullptr.
  const std::string* Value(const std::string& name,
                           const std::string& key) const;

  // Copies the value of `key` in section `name` into `buf` (`size` bytes,
  // NUL included). Returns its length, or -1 with the platform error set
  // (KERR_NOT_FOUND, KERR_BUFFER_TOO_SMALL).
  int CopyValue(const std::string& name, const std::string& key, char* buf,
                int size) const;

  // Section names in file order.
  size_t Count() const { return sections_.size(); }
  const std::string& NameAt(size_t i) const { return sections_[i].name; }

  // Sets `key` in `pairs`, in place when present, else at the end.
  static void Set(SectionPairs* pairs, const std::string& key,
                  const std::string& value);

  // The file as the writers produce it.
  std::string Render() const;

 private:
  using KeyIndex = std::unordered_map<std::string, size_t>;
  bool ParseLine(std::string_view line,
                 std::vector<std::unique_ptr<KeyIndex>>* keys, long* current);

  struct Section {
    std::string name;
    SectionPairs pairs;
  };
  std::vector<Section> sections_;
  std::unordered_map<std::string, size_t> index_;
};

// Whether the format can hold a section name, a key, a value: see the
// refused names and values in karo_section.h.
bool SectionNameHoldable(const char* s);
bool SectionKeyHoldable(const char* s);
bool SectionValueHoldable(const char* s);

}  // namespace karo_detail

#endif  // KARO_SECTION_DOC_H_
