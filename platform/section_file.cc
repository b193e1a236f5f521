// The C section calls: each reads the whole file into a SectionDoc (a
// reader of one section keeps only that one), changes it there, and writes
// it back through a temporary file that is renamed over the old one. Comments
// and the spacing a person typed are not preserved by a rewrite; the content
// is.
#include <string.h>
#include <unistd.h>

#include <string>

#include "karo_err.h"
#include "karo_section.h"
#include "section_doc.h"

namespace {

using karo_detail::SectionDoc;
using karo_detail::SectionPairs;

// Checks the arguments every writer shares; 0, or -1 with the error set.
int CheckWrite(const char* file, const char* section, const KSZHASH* values,
               const char* format) {
  if (file == nullptr || section == nullptr || values == nullptr ||
      (format != nullptr && strcmp(format, KLIBC_SECTION_PAIR_FORMAT) != 0)) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (!karo_detail::SectionNameHoldable(section)) {
    KLIBCErrSet(KERR_VALUE_UNHOLDABLE);
    return -1;
  }
  for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
    if (!karo_detail::SectionKeyHoldable(KLIBCSzHashKeyAt(values, i)) ||
        !karo_detail::SectionValueHoldable(KLIBCSzHashValueAt(values, i))) {
      KLIBCErrSet(KERR_VALUE_UNHOLDABLE);
      return -1;
    }
  }
  return 0;
}

SectionPairs ToPairs(const KSZHASH* values) {
  SectionPairs pairs;
  for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
    SectionDoc::Set(&pairs, KLIBCSzHashKeyAt(values, i),
                    KLIBCSzHashValueAt(values, i));
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
  SectionDoc doc;
  if (doc.LoadOne(file, section) != 0) return -1;
  const SectionPairs* pairs = doc.Find(section);
  if (pairs == nullptr) return 0;
  for (const auto& p : *pairs) {
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
  SectionDoc doc;
  if (doc.LoadOne(file, section) != 0) return -1;
  return doc.CopyValue(section, key, buf, size);
}

extern "C" int KLIBCFileSetSection(const char* file, const char* section,
                                   int flags, const KSZHASH* values,
                                   const char* format) {
  if (flags != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (CheckWrite(file, section, values, format) != 0) return -1;
  SectionDoc doc;
  if (doc.Load(file) != 0) return -1;
  SectionPairs* pairs = doc.Find(section);
  if (pairs == nullptr) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  *pairs = ToPairs(values);
  if (doc.Store(file) != 0) return -1;
  return static_cast<int>(pairs->size());
}

extern "C" int KLIBCIFileModifySection(const char* file, const char* section,
                                       int flags, const KSZHASH* values,
                                       int create_file, int reserved) {
  if (flags != 0 || reserved != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (CheckWrite(file, section, values, nullptr) != 0) return -1;
  SectionDoc doc;
  if (doc.Load(file) != 0) {
    if (!create_file || KLIBCErrGet() != KERR_FILE_NOT_FOUND) return -1;
    return doc.Store(file) == 0 ? 0 : -1;
  }
  SectionPairs* pairs = doc.Find(section);
  if (pairs == nullptr) return 0;
  for (const auto& p : ToPairs(values)) {
    SectionDoc::Set(pairs, p.first, p.second);
  }
  return doc.Store(file) == 0 ? 1 : -1;
}

extern "C" int KLIBCFileAddSection(const char* file, const char* section,
                                   const KSZHASH* values, const char* format) {
  if (CheckWrite(file, section, values, format) != 0) return -1;
  SectionDoc doc;
  if (doc.Load(file) != 0 && KLIBCErrGet() != KERR_FILE_NOT_FOUND) {
    return -1;
  }
  *doc.Add(section) = ToPairs(values);
  return doc.Store(file) == 0 ? 1 : -1;
}

extern "C" int KLIBCFileEnumSection(const char* file, KSZLIST* out) {
  if (file == nullptr || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  SectionDoc doc;
  if (doc.Load(file) != 0) return -1;
  for (size_t i = 0; i < doc.Count(); ++i) {
    if (KLIBCSzListPush(out, doc.NameAt(i).c_str()) != 0) return -1;
  }
  return static_cast<int>(doc.Count());
}
