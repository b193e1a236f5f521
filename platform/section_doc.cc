// A section file in memory: one pass over the text to read it, one rendering
// and an atomic replace to write it.
#include "section_doc.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <string_view>

#include "karo_err.h"

namespace karo_detail {

namespace {

const char kBlanks[] = " \t\r";

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\r'; }

std::string_view Trim(std::string_view s) {
  size_t b = 0, e = s.size();
  while (b < e && IsBlank(s[b])) ++b;
  while (e > b && IsBlank(s[e - 1])) --e;
  return s.substr(b, e - b);
}

bool HasOuterBlanks(const char* s) {
  size_t n = strlen(s);
  return n > 0 && (strchr(kBlanks, s[0]) != nullptr ||
                   strchr(kBlanks, s[n - 1]) != nullptr);
}

// A name or key is refused when reading it back would give something else:
// a line break ends the line, brackets make a section line, '=' ends a key,
// quotes would be taken for the value, blanks are trimmed and '#' starts a
// comment.
bool NameHoldable(const char* s, const char* forbidden) {
  return s[0] != '\0' && s[0] != '#' && !HasOuterBlanks(s) &&
         strpbrk(s, forbidden) == nullptr;
}

// A section's keys are looked up by scanning its pairs up to this many;
// beyond, through an index of its own, so that a section of many keys does
// not make reading quadratic.
const size_t kScanLimit = 16;

using KeyIndex = std::unordered_map<std::string, size_t>;

// Sets `key` in `pairs` while loading; `index` is the section's key index,
// made once it outgrows kScanLimit.
void LoadPair(SectionPairs* pairs, std::unique_ptr<KeyIndex>* index,
              std::string_view key, std::string_view value) {
  long at = -1;
  if (*index) {
    auto it = (*index)->find(std::string(key));
    if (it != (*index)->end()) at = static_cast<long>(it->second);
  } else {
    for (size_t i = 0; i < pairs->size() && at < 0; ++i) {
      if ((*pairs)[i].first == key) at = static_cast<long>(i);
    }
  }
  // Of a key given twice, the last value wins, in the first one's place.
  if (at >= 0) {
    (*pairs)[static_cast<size_t>(at)].second.assign(value);
    return;
  }
  pairs->emplace_back(std::string(key), std::string(value));
  if (*index) {
    (*index)->emplace(pairs->back().first, pairs->size() - 1);
  } else if (pairs->size() > kScanLimit) {
    index->reset(new KeyIndex);
    for (size_t i = 0; i < pairs->size(); ++i) {
      (*index)->emplace((*pairs)[i].first, i);
    }
  }
}

// A line "\tkey=\"value\"" exactly as the writers produce it: a line that
// reads as that pair and that the writers would write the same.
bool WritersPair(std::string_view line, std::string_view* key,
                 std::string_view* value) {
  if (line.size() < 5 || line[0] != '\t') return false;
  size_t eq = line.find('=');
  if (eq == std::string_view::npos || eq < 2) return false;
  std::string_view k = line.substr(1, eq - 1);
  // '#' would make a comment of the line, '[' a section.
  if (IsBlank(k.front()) || IsBlank(k.back()) || k.front() == '#' ||
      k.front() == '[') {
    return false;
  }
  std::string_view v = line.substr(eq + 1);
  if (v.size() < 2 || v.front() != '"' || v.back() != '"') return false;
  *key = k;
  *value = v.substr(1, v.size() - 2);
  return true;
}

bool WriteAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

bool ReadAll(const char* file, std::string* text) {
  int fd = open(file, O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    KLIBCErrSet(errno == ENOENT ? KERR_FILE_NOT_FOUND : KERR_SYSTEM);
    return false;
  }
  // Read straight into the text, one byte more than the file's size so that
  // the end is seen without another call when the size holds.
  struct stat st;
  size_t size = fstat(fd, &st) == 0 && st.st_size > 0
                    ? static_cast<size_t>(st.st_size) + 1
                    : 4096;
  size_t done = 0;
  for (;;) {
    if (done == size) size *= 2;
    text->resize(size);
    ssize_t n = read(fd, &(*text)[done], size - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      close(fd);
      text->clear();
      KLIBCErrSet(KERR_SYSTEM);
      return false;
    }
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  close(fd);
  text->resize(done);
  return true;
}

}  // namespace

bool SectionNameHoldable(const char* s) { return NameHoldable(s, "\r\n[]"); }

bool SectionKeyHoldable(const char* s) { return NameHoldable(s, "\r\n=[]\""); }

// Values sit between quotes, so blanks and quotes survive; only a line break
// cannot.
bool SectionValueHoldable(const char* s) {
  return strpbrk(s, "\r\n") == nullptr;
}

void SectionDoc::Clear() {
  sections_.clear();
  slots_.clear();
}

// The slot of `name`, or the free slot where it would go.
size_t SectionDoc::Slot(std::string_view name) const {
  const size_t mask = slots_.size() - 1;
  for (size_t i = std::hash<std::string_view>()(name) & mask;;
       i = (i + 1) & mask) {
    if (slots_[i] == 0 || sections_[slots_[i] - 1].name == name) return i;
  }
}

// The place of section `name`, made at the end when new; and whether it is.
std::pair<size_t, bool> SectionDoc::Intern(std::string_view name) {
  // At most half full, so that probes stay short.
  if (2 * (sections_.size() + 1) > slots_.size()) {
    slots_.assign(std::max<size_t>(64, 2 * slots_.size()), 0);
    for (size_t i = 0; i < sections_.size(); ++i) {
      slots_[Slot(sections_[i].name)] = static_cast<uint32_t>(i + 1);
    }
  }
  size_t slot = Slot(name);
  if (slots_[slot] != 0) return {slots_[slot] - 1, false};
  sections_.emplace_back();
  sections_.back().name.assign(name);
  slots_[slot] = static_cast<uint32_t>(sections_.size());
  return {sections_.size() - 1, true};
}

int SectionDoc::Load(const char* file) { return Read(file, nullptr); }

int SectionDoc::LoadOne(const char* file, const std::string& name) {
  return Read(file, &name);
}

// What a person typed is parsed whole, and written back in the writers'
// form; a file already in that form is only indexed.
int SectionDoc::Read(const char* file, const std::string* only) {
  Clear();
  text_.clear();
  if (!ReadAll(file, &text_)) {
    text_.clear();
    return -1;
  }
  if (text_.find('\0') != std::string::npos) {
    text_.clear();
    KLIBCErrSet(KERR_FILE_FORMAT);
    return -1;
  }
  if (IndexWritersForm(only)) return 0;
  std::string text;
  text.swap(text_);
  return Parse(text, only);
}

// Parses `text` whole, keeping only section `*only` when `only` is given.
int SectionDoc::Parse(const std::string& text, const std::string* only) {
  Clear();
  const std::string_view all(text);
  // Most sections take a few lines of some 20 bytes.
  if (only == nullptr) sections_.reserve(text.size() / 64);
  std::vector<std::unique_ptr<KeyIndex>> keys;  // per section, when large
  long current = -1;
  for (size_t pos = 0; pos < all.size();) {
    size_t end = all.find('\n', pos);
    if (end == std::string_view::npos) end = all.size();
    std::string_view line = Trim(all.substr(pos, end - pos));
    pos = end + 1;
    if (line.empty() || line[0] == '#') continue;
    if (!ParseLine(line, only, &keys, &current)) {
      Clear();
      KLIBCErrSet(KERR_FILE_FORMAT);
      return -1;
    }
  }
  return 0;
}

// Indexes text_ (its section `*only` alone, when given) when it is in the
// writers' form: "[name]" and "\tkey=\"value\"" lines only, every line
// ended, each section kept once and each of its keys once. False (the index
// half made) for any other text.
bool SectionDoc::IndexWritersForm(const std::string* only) {
  const char* const first = text_.data();
  const char* const stop = first + text_.size();
  if (first == stop) return true;
  if (stop[-1] != '\n') return false;
  if (only == nullptr) {
    // Sections of a few lines of some 20 bytes; the slots twice as many.
    sections_.reserve(text_.size() / 64);
    size_t slots = 64;
    while (slots < text_.size() / 16) slots *= 2;
    slots_.assign(slots, 0);
  }
  // The kept section's keys, for the check that none comes twice.
  std::string_view keys[kScanLimit];
  size_t key_count = 0;
  bool in_section = false, kept = false;
  for (const char* p = first; p != stop;) {
    const char* nl = static_cast<const char*>(memchr(p, '\n', stop - p));
    const char* line = p;
    p = nl + 1;
    if (*line == '[') {
      if (nl - line < 3 || nl[-1] != ']') return false;
      std::string_view name(line + 1, nl - line - 2);
      if (IsBlank(name.front()) || IsBlank(name.back())) return false;
      in_section = true;
      kept = only == nullptr || name == *only;
      if (!kept) continue;
      if (!Intern(name).second) return false;
      Section& s = sections_.back();
      s.parsed = false;
      s.begin = s.end = static_cast<size_t>(p - first);
      key_count = 0;
      continue;
    }
    // "\tkey=\"value\"", the key up to the first '='; a key that starts
    // with '#' or '[' would read as a comment or a section.
    if (!in_section || *line != '\t') return false;
    const char* eq = static_cast<const char*>(memchr(line, '=', nl - line));
    if (eq == nullptr || eq - line < 2 || nl - eq < 3 || eq[1] != '"' ||
        nl[-1] != '"' || IsBlank(line[1]) || IsBlank(eq[-1]) ||
        line[1] == '#' || line[1] == '[') {
      return false;
    }
    if (!kept) continue;
    // Beyond kScanLimit keys the parse's key index does better.
    if (key_count == kScanLimit) return false;
    std::string_view key(line + 1, eq - line - 1);
    for (size_t i = 0; i < key_count; ++i) {
      const std::string_view k = keys[i];
      if (k.size() == key.size() && k.back() == key.back() && k == key) {
        return false;
      }
    }
    keys[key_count++] = key;
    sections_.back().end = static_cast<size_t>(p - first);
  }
  return true;
}

// The pairs of section `i`, parsed from text_ the first time.
SectionPairs* SectionDoc::Pairs(size_t i) const {
  Section& s = sections_[i];
  if (!s.parsed) {
    const std::string_view all(text_);
    for (size_t pos = s.begin; pos < s.end;) {
      size_t end = all.find('\n', pos);
      std::string_view key, value;
      WritersPair(all.substr(pos, end - pos), &key, &value);
      s.pairs.emplace_back(std::string(key), std::string(value));
      pos = end + 1;
    }
    s.parsed = true;
  }
  return &s.pairs;
}

// One trimmed, non-blank, non-comment line; `current` is the section that
// pairs go to (-1 before the first one, -2 in a section not kept).
bool SectionDoc::ParseLine(std::string_view line, const std::string* only,
                           std::vector<std::unique_ptr<KeyIndex>>* keys,
                           long* current) {
  if (line[0] == '[') {
    if (line.back() != ']') return false;
    std::string_view name = Trim(line.substr(1, line.size() - 2));
    if (name.empty()) return false;
    if (only != nullptr && name != *only) {
      *current = -2;
      return true;
    }
    // A section named twice is read as one.
    std::pair<size_t, bool> at = Intern(name);
    if (at.second) keys->emplace_back();
    *current = static_cast<long>(at.first);
    return true;
  }
  size_t eq = line.find('=');
  if (*current == -1 || eq == std::string_view::npos) return false;
  std::string_view key = Trim(line.substr(0, eq));
  std::string_view value = Trim(line.substr(eq + 1));
  if (key.empty()) return false;
  if (!value.empty() && value[0] == '"') {
    if (value.size() < 2 || value.back() != '"') return false;
    value = value.substr(1, value.size() - 2);
  }
  if (*current == -2) return true;
  const size_t sec = static_cast<size_t>(*current);
  LoadPair(&sections_[sec].pairs, &(*keys)[sec], key, value);
  return true;
}

int SectionDoc::Store(const char* file) const {
  std::string path(file);
  size_t slash = path.rfind('/');
  std::string dir = slash == std::string::npos ? "." : path.substr(0, slash);
  if (dir.empty()) dir = "/";
  std::string tmp =
      (slash == std::string::npos ? std::string() : path.substr(0, slash + 1)) +
      "." + path.substr(slash + 1) + ".XXXXXX";
  struct stat st;
  mode_t mode = stat(file, &st) == 0 ? (st.st_mode & 07777) : 0644;
  int fd = mkostemp(&tmp[0], O_CLOEXEC);
  if (fd < 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  bool ok = fchmod(fd, mode) == 0 && WriteAll(fd, Render()) && fsync(fd) == 0;
  ok = close(fd) == 0 && ok;
  if (!ok || rename(tmp.c_str(), file) != 0) {
    int saved = errno;
    unlink(tmp.c_str());
    errno = saved;
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  // The rename itself must reach the disk for the new content to survive a
  // power loss.
  int dfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dfd >= 0) {
    fsync(dfd);
    close(dfd);
  }
  return 0;
}

const SectionPairs* SectionDoc::Find(const std::string& name) const {
  if (slots_.empty()) return nullptr;
  uint32_t at = slots_[Slot(name)];
  return at == 0 ? nullptr : Pairs(at - 1);
}

SectionPairs* SectionDoc::Find(const std::string& name) {
  return const_cast<SectionPairs*>(
      static_cast<const SectionDoc*>(this)->Find(name));
}

SectionPairs* SectionDoc::Add(const std::string& name) {
  return Pairs(Intern(name).first);
}

const std::string* SectionDoc::Value(const std::string& name,
                                     const std::string& key) const {
  const SectionPairs* pairs = Find(name);
  if (pairs == nullptr) return nullptr;
  for (const auto& p : *pairs) {
    if (p.first == key) return &p.second;
  }
  return nullptr;
}

int SectionDoc::CopyValue(const std::string& name, const std::string& key,
                          char* buf, int size) const {
  const std::string* value = Value(name, key);
  if (value == nullptr) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  if (value->size() >= static_cast<size_t>(size)) {
    KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
    return -1;
  }
  memcpy(buf, value->c_str(), value->size() + 1);
  return static_cast<int>(value->size());
}

void SectionDoc::Set(SectionPairs* pairs, const std::string& key,
                     const std::string& value) {
  for (auto& p : *pairs) {
    if (p.first == key) {
      p.second = value;
      return;
    }
  }
  pairs->emplace_back(key, value);
}

std::string SectionDoc::Render() const {
  size_t size = 0;
  for (const auto& s : sections_) {
    size += s.name.size() + 3 + (s.parsed ? 0 : s.end - s.begin);
    for (const auto& p : s.pairs) size += p.first.size() + p.second.size() + 5;
  }
  std::string text;
  text.reserve(size);
  for (const auto& s : sections_) {
    text.append("[").append(s.name).append("]\n");
    if (!s.parsed) text.append(text_, s.begin, s.end - s.begin);
    for (const auto& p : s.pairs) {
      text.append("\t").append(p.first).append("=\"");
      text.append(p.second).append("\"\n");
    }
  }
  return text;
}

}  // namespace karo_detail
