// Ordered string list.
#include <new>
#include <string>
#include <vector>

#include "karo_err.h"
#include "karo_section.h"

struct KSZLIST {
  std::vector<std::string> items;
};

extern "C" KSZLIST* KLIBCSzListAlloc(void) {
  KSZLIST* list = new (std::nothrow) KSZLIST;
  if (list == nullptr) KLIBCErrSet(KERR_NO_MEMORY);
  return list;
}

extern "C" void KLIBCSzListFree(KSZLIST* list) { delete list; }

extern "C" int KLIBCSzListPush(KSZLIST* list, const char* s) {
  if (list == nullptr || s == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  list->items.emplace_back(s);
  return 0;
}

extern "C" int KLIBCSzListCount(const KSZLIST* list) {
  return list == nullptr ? 0 : static_cast<int>(list->items.size());
}

extern "C" const char* KLIBCSzListGet(const KSZLIST* list, int i) {
  if (i < 0 || i >= KLIBCSzListCount(list)) return nullptr;
  return list->items[i].c_str();
}
