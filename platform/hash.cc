// Insertion-ordered string hash. Lookups are linear: the hashes the library
// builds hold a handful of keys (a registry section, a command's values), and
// keeping insertion order matters more than asymptotics because sections are
// written back in the order their keys were set.
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "karo_err.h"
#include "karo_section.h"

struct KSZHASH {
  int capacity;
  std::vector<std::pair<std::string, std::string>> pairs;
};

namespace {

int IndexOf(const KSZHASH* hash, const char* key) {
  for (size_t i = 0; i < hash->pairs.size(); ++i) {
    if (hash->pairs[i].first == key) return static_cast<int>(i);
  }
  return -1;
}

}  // namespace

extern "C" KSZHASH* KLIBCSzHashAlloc(int capacity) {
  if (capacity < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return nullptr;
  }
  KSZHASH* hash = new (std::nothrow) KSZHASH;
  if (hash == nullptr) {
    KLIBCErrSet(KERR_NO_MEMORY);
    return nullptr;
  }
  hash->capacity = capacity;
  return hash;
}

extern "C" void KLIBCSzHashFree(KSZHASH* hash) { delete hash; }

extern "C" int KLIBCSzHashSetValue(KSZHASH* hash, const char* key,
                                   const char* value) {
  if (hash == nullptr || key == nullptr || value == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  int i = IndexOf(hash, key);
  if (i >= 0) {
    hash->pairs[i].second = value;
    return 0;
  }
  if (static_cast<int>(hash->pairs.size()) >= hash->capacity) {
    KLIBCErrSet(KERR_NO_MEMORY);
    return -1;
  }
  hash->pairs.emplace_back(key, value);
  return 0;
}

extern "C" const char* KLIBCSzHashGetValue(const KSZHASH* hash,
                                           const char* key) {
  if (hash == nullptr || key == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return nullptr;
  }
  int i = IndexOf(hash, key);
  if (i < 0) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return nullptr;
  }
  return hash->pairs[i].second.c_str();
}

extern "C" int KLIBCSzHashRemove(KSZHASH* hash, const char* key) {
  int i = (hash == nullptr || key == nullptr) ? -1 : IndexOf(hash, key);
  if (i < 0) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  hash->pairs.erase(hash->pairs.begin() + i);
  return 0;
}

extern "C" int KLIBCSzHashCount(const KSZHASH* hash) {
  return hash == nullptr ? 0 : static_cast<int>(hash->pairs.size());
}

extern "C" const char* KLIBCSzHashKeyAt(const KSZHASH* hash, int i) {
  if (i < 0 || i >= KLIBCSzHashCount(hash)) return nullptr;
  return hash->pairs[i].first.c_str();
}

extern "C" const char* KLIBCSzHashValueAt(const KSZHASH* hash, int i) {
  if (i < 0 || i >= KLIBCSzHashCount(hash)) return nullptr;
  return hash->pairs[i].second.c_str();
}

extern "C" void KLIBCSzHashClear(KSZHASH* hash) {
  if (hash != nullptr) hash->pairs.clear();
}
