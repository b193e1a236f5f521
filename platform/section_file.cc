// Section files: parse the whole file into memory, change it there, and write
// it back through a temporary file that is renamed over the old one. Comments
// and the spacing a person typed are not preserved by a rewrite; the content
// is.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include "karo_err.h"
#include "karo_section.h"

namespace {

using Pairs = std::vector<std::pair<std::string, std::string>>;

struct Section {
  std::string name;
  Pairs pairs;
};

using Sections = std::vector<Section>;

const char kBlanks[] = " \t\r";

std::string Trim(const std::string& s) {
  size_t b = s.find_first_not_of(kBlanks);
  if (b == std::string::npos) return "";
  size_t e = s.find_last_not_of(kBlanks);
  return s.substr(b, e - b + 1);
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

bool SectionNameHoldable(const char* s) { return NameHoldable(s, "\r\n[]"); }

bool KeyHoldable(const char* s) { return NameHoldable(s, "\r\n=[]\""); }

// Values sit between quotes, so blanks and quotes survive; only a line break
// cannot.
bool ValueHoldable(const char* s) { return strpbrk(s, "\r\n") == nullptr; }

void SetPair(Pairs* pairs, const std::string& key, const std::string& value) {
  for (auto& p : *pairs) {
    if (p.first == key) {
      p.second = value;
      return;
    }
  }
  pairs->emplace_back(key, value);
}

Section* Find(Sections* sections, const std::string& name) {
  for (auto& s : *sections) {
    if (s.name == name) return &s;
  }
  return nullptr;
}

// Parses one trimmed, non-blank, non-comment line into `out`; `current` is
// the index of the section that pairs go to (-1 before the first one).
bool ParseLine(const std::string& line, Sections* out, int* current) {
  if (line[0] == '[') {
    if (line.back() != ']') return false;
    std::string name = Trim(line.substr(1, line.size() - 2));
    if (name.empty()) return false;
    // A section named twice is read as one.
    Section* s = Find(out, name);
    if (s == nullptr) {
      out->push_back(Section{name, {}});
      s = &out->back();
    }
    *current = static_cast<int>(s - out->data());
    return true;
  }
  size_t eq = line.find('=');
  if (*current < 0 || eq == std::string::npos) return false;
  std::string key = Trim(line.substr(0, eq));
  std::string value = Trim(line.substr(eq + 1));
  if (key.empty()) return false;
  if (!value.empty() && value[0] == '"') {
    if (value.size() < 2 || value.back() != '"') return false;
    value = value.substr(1, value.size() - 2);
  }
  SetPair(&(*out)[*current].pairs, key, value);
  return true;
}

// Reads and parses `file`. 0, or -1 with the platform error set.
int Load(const char* file, Sections* out) {
  FILE* f = fopen(file, "re");
  if (f == nullptr) {
    KLIBCErrSet(errno == ENOENT ? KERR_FILE_NOT_FOUND : KERR_SYSTEM);
    return -1;
  }
  std::string text;
  char buf[8192];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, f)) > 0) text.append(buf, n);
  bool failed = ferror(f) != 0;
  fclose(f);
  if (failed) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  if (text.find('\0') != std::string::npos) {
    KLIBCErrSet(KERR_FILE_FORMAT);
    return -1;
  }
  size_t pos = 0;
  int current = -1;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string::npos) end = text.size();
    std::string line = Trim(text.substr(pos, end - pos));
    pos = end + 1;
    if (line.empty() || line[0] == '#') continue;
    if (!ParseLine(line, out, &current)) {
      KLIBCErrSet(KERR_FILE_FORMAT);
      return -1;
    }
  }
  return 0;
}

std::string Render(const Sections& sections) {
  std::string text;
  for (const auto& s : sections) {
    text += "[" + s.name + "]\n";
    for (const auto& p : s.pairs) {
      text += "\t" + p.first + "=\"" + p.second + "\"\n";
    }
  }
  return text;
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

// Replaces `file` with `sections`: a reader sees the old or the new file,
// never a mix. An existing file keeps its mode; a new one gets 0644.
int Store(const char* file, const Sections& sections) {
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
  bool ok =
      fchmod(fd, mode) == 0 && WriteAll(fd, Render(sections)) && fsync(fd) == 0;
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

// Checks the arguments every writer shares; 0, or -1 with the error set.
int CheckWrite(const char* file, const char* section, const KSZHASH* values,
               const char* format) {
  if (file == nullptr || section == nullptr || values == nullptr ||
      (format != nullptr && strcmp(format, KLIBC_SECTION_PAIR_FORMAT) != 0)) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (!SectionNameHoldable(section)) {
    KLIBCErrSet(KERR_VALUE_UNHOLDABLE);
    return -1;
  }
  for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
    if (!KeyHoldable(KLIBCSzHashKeyAt(values, i)) ||
        !ValueHoldable(KLIBCSzHashValueAt(values, i))) {
      KLIBCErrSet(KERR_VALUE_UNHOLDABLE);
      return -1;
    }
  }
  return 0;
}

Pairs ToPairs(const KSZHASH* values) {
  Pairs pairs;
  for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
    SetPair(&pairs, KLIBCSzHashKeyAt(values, i), KLIBCSzHashValueAt(values, i));
  }
  return pairs;
}

}  // namespace

extern "C" int KLIBCFileExist(const char* path) {
  return path != nullptr && access(path, F_OK) == 0 ? 1 : 0;
}

extern "C" int KLIBCFileGetSection(const char* file, const char* section,
                                   KSZHASH* out) {
  if (file == nullptr || section == nullptr || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  Sections sections;
  if (Load(file, &sections) != 0) return -1;
  const Section* s = Find(&sections, section);
  if (s == nullptr) return 0;
  for (const auto& p : s->pairs) {
    if (KLIBCSzHashSetValue(out, p.first.c_str(), p.second.c_str()) != 0) {
      return -1;
    }
  }
  return 1;
}

extern "C" int KLIBCFileGetSectionValue(const char* file, const char* section,
                                        const char* key, char* buf, int size) {
  if (file == nullptr || section == nullptr || key == nullptr ||
      buf == nullptr || size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  Sections sections;
  if (Load(file, &sections) != 0) return -1;
  const Section* s = Find(&sections, section);
  if (s != nullptr) {
    for (const auto& p : s->pairs) {
      if (p.first != key) continue;
      if (p.second.size() >= static_cast<size_t>(size)) {
        KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
        return -1;
      }
      memcpy(buf, p.second.c_str(), p.second.size() + 1);
      return static_cast<int>(p.second.size());
    }
  }
  KLIBCErrSet(KERR_NOT_FOUND);
  return -1;
}

extern "C" int KLIBCFileSetSection(const char* file, const char* section,
                                   int flags, const KSZHASH* values,
                                   const char* format) {
  if (flags != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (CheckWrite(file, section, values, format) != 0) return -1;
  Sections sections;
  if (Load(file, &sections) != 0) return -1;
  Section* s = Find(&sections, section);
  if (s == nullptr) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  s->pairs = ToPairs(values);
  if (Store(file, sections) != 0) return -1;
  return static_cast<int>(s->pairs.size());
}

extern "C" int KLIBCIFileModifySection(const char* file, const char* section,
                                       int flags, const KSZHASH* values,
                                       int create_file, int reserved) {
  if (flags != 0 || reserved != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (CheckWrite(file, section, values, nullptr) != 0) return -1;
  Sections sections;
  if (Load(file, &sections) != 0) {
    if (!create_file || KLIBCErrGet() != KERR_FILE_NOT_FOUND) return -1;
    return Store(file, sections) == 0 ? 0 : -1;
  }
  Section* s = Find(&sections, section);
  if (s == nullptr) return 0;
  for (const auto& p : ToPairs(values)) SetPair(&s->pairs, p.first, p.second);
  return Store(file, sections) == 0 ? 1 : -1;
}

extern "C" int KLIBCFileAddSection(const char* file, const char* section,
                                   const KSZHASH* values, const char* format) {
  if (CheckWrite(file, section, values, format) != 0) return -1;
  Sections sections;
  if (Load(file, &sections) != 0 && KLIBCErrGet() != KERR_FILE_NOT_FOUND) {
    return -1;
  }
  Section* s = Find(&sections, section);
  if (s == nullptr) {
    sections.push_back(Section{section, ToPairs(values)});
  } else {
    s->pairs = ToPairs(values);
  }
  return Store(file, sections) == 0 ? 1 : -1;
}

extern "C" int KLIBCFileEnumSection(const char* file, KSZLIST* out) {
  if (file == nullptr || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  Sections sections;
  if (Load(file, &sections) != 0) return -1;
  for (const auto& s : sections) {
    if (KLIBCSzListPush(out, s.name.c_str()) != 0) return -1;
  }
  return static_cast<int>(sections.size());
}
