// Internal: a section file held in memory, as the section calls of
// karo_section.h read and write it. Callers that need several sections or
// keys of one file read it once into a SectionDoc and write it back once,
// instead of a section call (a whole parse) per key. Not part of the C API.
//
// Loading is linear in the file's size: sections are indexed by name, and
// keys by section and name, while the file is read. A file in the very form
// the writers produce is only indexed by section: a section's pairs are read
// when it is first looked at, and a section never looked at is written back
// as it was read, so that a command touching one section of thousands pays
// for a scan and a copy of the rest, not for parsing it. The grammar, the
// refused names and values, and the atomic replace are those of
// karo_section.h.
//
// Not thread-safe, not even for lookups, which may parse a section.
#ifndef KARO_SECTION_DOC_H_
#define KARO_SECTION_DOC_H_

#include <stddef.h>
#include <stdint.h>

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
  // The same for a reader of one section: the content is section `name` of
  // `file` alone (or nothing); the rest of the file is checked, not kept.
  int LoadOne(const char* file, const std::string& name);

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
  bool IndexWritersForm(const std::string* only);
  // Load and LoadOne: `only` keeps that one section alone.
  int Read(const char* file, const std::string* only);
  int Parse(const std::string& text, const std::string* only);
  bool ParseLine(std::string_view line, const std::string* only,
                 std::vector<std::unique_ptr<KeyIndex>>* keys, long* current);
  SectionPairs* Pairs(size_t i) const;
  size_t Slot(std::string_view name) const;
  std::pair<size_t, bool> Intern(std::string_view name);
  void Clear();

  struct Section {
    std::string name;
    SectionPairs pairs;
    // While not parsed, the pairs are the lines text_[begin, end).
    bool parsed = true;
    size_t begin = 0, end = 0;
  };
  // Lookups parse sections on the way.
  mutable std::vector<Section> sections_;
  // The sections by name, open addressing: 0 for a free slot, else the
  // section's place + 1. No allocation per section.
  std::vector<uint32_t> slots_;
  std::string text_;  // the file as read, while a section is not parsed
};

// Whether the format can hold a section name, a key, a value: see the
// refused names and values in karo_section.h.
bool SectionNameHoldable(const char* s);
bool SectionKeyHoldable(const char* s);
bool SectionValueHoldable(const char* s);

}  // namespace karo_detail

#endif  // KARO_SECTION_DOC_H_
