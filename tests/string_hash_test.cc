#include <gtest/gtest.h>

#include "karo_err.h"
#include "karo_section.h"

namespace {

TEST(StringHash, KeepsInsertionOrderAndHonoursCapacity) {
  KSZHASH* h = KLIBCSzHashAlloc(2);
  ASSERT_NE(h, nullptr);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "b", "1"), 0);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "a", "2"), 0);
  EXPECT_EQ(KLIBCSzHashSetValue(h, "b", "3"), 0);  // replaced in place
  EXPECT_EQ(KLIBCSzHashSetValue(h, "c", "4"), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_NO_MEMORY);
  EXPECT_STREQ(KLIBCSzHashKeyAt(h, 0), "b");
  EXPECT_STREQ(KLIBCSzHashValueAt(h, 0), "3");
  EXPECT_EQ(KLIBCSzHashKeyAt(h, 2), nullptr);
  EXPECT_EQ(KLIBCSzHashGetValue(h, "c"), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  EXPECT_EQ(KLIBCSzHashRemove(h, "b"), 0);
  EXPECT_EQ(KLIBCSzHashRemove(h, "b"), -1);
  EXPECT_STREQ(KLIBCSzHashGetValue(h, "a"), "2");
  KLIBCSzHashClear(h);
  EXPECT_EQ(KLIBCSzHashCount(h), 0);
  KLIBCSzHashFree(h);
  EXPECT_EQ(KLIBCSzHashAlloc(0), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);
}

TEST(StringListAndString, CopiesInOrderAndFormats) {
  KSZLIST* l = KLIBCSzListAlloc();
  char s[] = "one";
  EXPECT_EQ(KLIBCSzListPush(l, s), 0);
  s[0] = 'X';
  EXPECT_EQ(KLIBCSzListPush(l, "two"), 0);
  EXPECT_EQ(KLIBCSzListPush(l, nullptr), -1);
  EXPECT_EQ(KLIBCSzListCount(l), 2);
  EXPECT_STREQ(KLIBCSzListGet(l, 0), "one");
  EXPECT_EQ(KLIBCSzListGet(l, 2), nullptr);
  KLIBCSzListFree(l);
  char* f = KLIBCStrGet("SHARE_%s_%d", "a", 7);
  EXPECT_STREQ(f, "SHARE_a_7");
  KLIBCStrPut(f);
  KLIBCStrPut(nullptr);
}

}  // namespace
