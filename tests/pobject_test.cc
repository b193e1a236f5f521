#include "S2S/pobject.h"

#include <gtest/gtest.h>

#include <stdexcept>

namespace {

using S2S::PObject;

PObject Int(int v) {
  PObject o;
  o = v;
  return o;
}

TEST(PObjectKinds, NullZeroAndEmptyContainers) {
  PObject null;
  EXPECT_TRUE(null.isNull());
  EXPECT_TRUE(null.isEmpty());
  EXPECT_FALSE(null.asBool());
  EXPECT_FALSE(null.isPrimitive() || null.isContainer());
  EXPECT_EQ(null.asString(), "");
  EXPECT_EQ(null.toString(), "null");
  EXPECT_FALSE(null.hasMember("a"));

  PObject zero = Int(0);  // an integer is never empty, not even 0
  EXPECT_FALSE(zero.isEmpty());
  EXPECT_FALSE(zero.asBool());
  EXPECT_TRUE(zero.isPrimitive());
  EXPECT_EQ(zero.typeCode(), 3);

  PObject a, m, s("x");
  a.asArray();
  m.asMap();
  EXPECT_EQ(a.typeCode(), 1);
  EXPECT_EQ(m.typeCode(), 2);
  EXPECT_EQ(s.typeCode(), 4);
  EXPECT_TRUE(a.isEmpty() && m.isEmpty() && a.isContainer());
}

TEST(PObjectConversions, MinusOneThroughEveryWidthAndOtherAssignments) {
  PObject o = Int(-1);
  EXPECT_EQ(o.asUInt64(), 18446744073709551615ull);
  EXPECT_EQ(o.asInteger(), 18446744073709551615ull);
  EXPECT_EQ(o.asInt64(), -1);
  EXPECT_EQ(o.asInt32(), -1);
  EXPECT_EQ(o.asUInt32(), 4294967295u);
  EXPECT_EQ(o.asUInt16(), 65535);
  EXPECT_EQ(o.asInt16(), -1);
  EXPECT_EQ(o.asUInt8(), 255);
  EXPECT_EQ(o.asInt8(), -1);
  EXPECT_EQ(o.asString(), "4294967295");
  EXPECT_EQ(o.toString(), "18446744073709551615");
  o = 4000000000u;  // zero-extended
  EXPECT_EQ(o.asUInt64(), 4000000000ull);
  o = true;
  EXPECT_EQ(o.asUInt64(), 1u);
  o = false;
  EXPECT_TRUE(o.isInteger());
  EXPECT_EQ(o.asUInt64(), 0u);
}

TEST(PObjectConversions, StringOfWideIntegerPrintsLow32Bits) {
  PObject o(4294967297ull);
  EXPECT_EQ(o.asString(), "1");
  EXPECT_EQ(o.toString(), "4294967297");
  EXPECT_EQ(PObject(4294967296ull).asString(), "0");
}

TEST(PObjectConversions, ConstViewsOfTheWrongKindNonConstViewsReplace) {
  PObject s("42");
  EXPECT_EQ(s.asUInt64(), 0u);  // no string-to-number conversion
  EXPECT_EQ(s.asInt32(), 0);
  EXPECT_EQ(PObject(7ull).asStringRef(), "");
  const PObject& cs = s;
  EXPECT_EQ(&cs.asMap(), &PObject::GetEmptyMap());
  EXPECT_EQ(&cs.asArray(), &PObject::GetEmptyArray());
  EXPECT_TRUE(s.isString());  // const views leave the value alone
  s.asArray().emplace_back("x");
  EXPECT_TRUE(s.isArray());
  EXPECT_EQ(s.asArray().size(), 1u);
  s.asMap()["k"] = 1u;
  EXPECT_TRUE(s.isMap());
  EXPECT_EQ(s.asMap().size(), 1u);
  EXPECT_EQ(s.asString(), "");
}

TEST(PObjectConversions, AsBoolOfStringsAndContainersIsNotEmpty) {
  EXPECT_TRUE(PObject("false").asBool());
  EXPECT_TRUE(PObject("0").asBool());
  EXPECT_FALSE(PObject("").asBool());
  PObject a;
  a.asArray();
  EXPECT_FALSE(a.asBool());
  a.asArray().emplace_back();
  EXPECT_TRUE(a.asBool());
}

TEST(PObjectIndex, StringKeyConstVersusNonConst) {
  PObject o = Int(7);
  const PObject& c = o;
  EXPECT_EQ(&c["k"], &PObject::GetEmptyObject());
  EXPECT_TRUE(o.isInteger());
  EXPECT_TRUE(o["k"].isNull());
  EXPECT_TRUE(o.isMap() && o.hasMember("k"));
  EXPECT_EQ(o.asMap().size(), 1u);
  o["a"] = 1u;
  EXPECT_EQ(c["a"].asUInt64(), 1u);
  EXPECT_EQ(&c["zz"], &PObject::GetEmptyObject());

  PObject arr;
  arr.asArray().emplace_back("x");
  arr["k"] = "v";
  EXPECT_TRUE(arr.isMap());
  EXPECT_EQ(arr.asMap().size(), 1u);
}

TEST(PObjectIndex, NumericIndexOnArraysIsReadOnly) {
  PObject a;
  a.asArray().emplace_back("only");
  const PObject& c = a;
  EXPECT_EQ(c[0u].asString(), "only");
  try {
    a[0u];
    FAIL() << "non-const numeric index on an array must throw";
  } catch (const std::out_of_range& e) {
    EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
  }
  PObject three;
  for (int i = 0; i < 3; ++i) three.asArray().emplace_back(Int(i));
  EXPECT_TRUE(static_cast<const PObject&>(three)[5u].isNull());
}

TEST(PObjectIndex, NumericIndexOnMapsWalksKeyOrder) {
  PObject m;
  m["b"] = 2u;
  m["a"] = 1u;
  m["c"] = 3u;
  const PObject& c = m;
  EXPECT_EQ(c[0u].asUInt64(), 1u);
  EXPECT_EQ(c[2u].asUInt64(), 3u);
  EXPECT_TRUE(c[3u].isNull());
  m[1u] = 20u;
  EXPECT_EQ(m["b"].asUInt64(), 20u);
  EXPECT_THROW(m[3u], std::out_of_range);
  PObject s("x"), n;
  EXPECT_THROW(s[0u], std::out_of_range);
  EXPECT_THROW(n[0u], std::out_of_range);
  EXPECT_TRUE(static_cast<const PObject&>(s)[0u].isNull());
}

TEST(PObjectCopy, SelfAssignmentAndCopyFromNullLeaveNull) {
  PObject a("value");
  PObject& alias = a;
  a = alias;
  EXPECT_TRUE(a.isNull());
  EXPECT_EQ(a.typeCode(), 0);
  PObject target("old"), null;
  target = null;
  EXPECT_TRUE(target.isNull());
}

TEST(PObjectCopy, ValueTakenFromItselfIsSafeOnTheTypedPath) {
  PObject a("value");
  a = a.asString();
  EXPECT_EQ(a.asString(), "value");
  PObject m;
  m["k"] = "v";
  m = m.asMap();  // copy<Map> allocates before it clears
  EXPECT_EQ(m["k"].asString(), "v");
}

TEST(PObjectCopy, DeepCopiesAreIndependent) {
  PObject src;
  src["list"].asArray().emplace_back("x");
  src["nested"]["inner"] = 5u;
  PObject copy(src);
  copy["nested"]["inner"] = 6u;
  copy["list"].asArray().emplace_back("y");
  EXPECT_EQ(src["nested"]["inner"].asUInt64(), 5u);
  EXPECT_EQ(src["list"].asArray().size(), 1u);
  PObject assigned;
  assigned = src;
  src.clear();
  EXPECT_TRUE(src.isNull());
  EXPECT_EQ(assigned.toString(),
            "{\"list\": [\"x\"], \"nested\": {\"inner\": 5}}");
}

TEST(PObjectCopy, StringsMoveInAndSwapExchanges) {
  std::string big(1000, 'm');
  const char* bytes = big.data();
  PObject p;
  p["x"] = 1ull;
  p = std::move(big);
  ASSERT_TRUE(p.isString());
  EXPECT_EQ(p.asStringRef().data(), bytes);  // taken over, not copied
  EXPECT_EQ(p.asStringRef(), std::string(1000, 'm'));
  PObject two(2ull);
  p.swap(two);
  EXPECT_EQ(p.asUInt64(), 2u);
  EXPECT_EQ(two.asStringRef().data(), bytes);
}

TEST(PObjectRender, NestedValuesAndRawStrings) {
  PObject m;
  m["a"] = 1u;
  m["b"].asArray().emplace_back("x");
  m["b"].asArray().emplace_back();
  EXPECT_EQ(m.toString(), "{\"a\": 1, \"b\": [\"x\", null]}");
  EXPECT_EQ(PObject("say \"hi\"\n").toString(), "\"say \"hi\"\n\"");
  PObject e;
  e.asArray();
  EXPECT_EQ(e.toString(), "[]");
  e.asMap();
  EXPECT_EQ(e.toString(), "{}");
}

TEST(PObjectDeep, ThousandsOfLevelsBuildCopyAndDestroy) {
  const int kDepth = 200000;
  PObject root;
  PObject* cur = &root;
  for (int i = 0; i < kDepth; ++i) {
    if (i % 2 == 0) {
      cur = &(*cur)["k"];
    } else {
      cur->asArray().emplace_back();
      cur = &cur->asArray().back();
    }
  }
  *cur = "leaf";
  PObject copy(root);
  const PObject* walk = &copy;
  int depth = 0;
  for (; walk->isContainer(); ++depth) {
    walk = walk->isMap() ? &walk->asMap().begin()->second : &walk->asArray()[0];
  }
  EXPECT_EQ(depth, kDepth);
  EXPECT_EQ(walk->asString(), "leaf");
  root.clear();
  EXPECT_TRUE(root.isNull());
}

}  // namespace
