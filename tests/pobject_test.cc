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

TEST(PObjectKinds, DefaultIsNullAndEmpty) {
  PObject o;
  EXPECT_TRUE(o.isNull());
  EXPECT_TRUE(o.isEmpty());
  EXPECT_FALSE(o.asBool());
  EXPECT_EQ(o.asString(), "");
  EXPECT_EQ(o.toString(), "null");
  EXPECT_FALSE(o.isPrimitive());
  EXPECT_FALSE(o.isContainer());
  EXPECT_FALSE(o.hasMember("a"));
}

TEST(PObjectKinds, IntegerZeroIsNotEmptyButFalse) {
  PObject o = Int(0);
  EXPECT_TRUE(o.isInteger());
  EXPECT_FALSE(o.isEmpty());
  EXPECT_FALSE(o.asBool());
  EXPECT_TRUE(o.isPrimitive());
  EXPECT_EQ(o.typeCode(), 3);
}

TEST(PObjectKinds, TypeCodesOfEveryKind) {
  PObject a, m, s("x"), i(1ull);
  a.asArray();
  m.asMap();
  EXPECT_EQ(a.typeCode(), 1);
  EXPECT_EQ(m.typeCode(), 2);
  EXPECT_EQ(i.typeCode(), 3);
  EXPECT_EQ(s.typeCode(), 4);
  EXPECT_TRUE(a.isContainer() && m.isContainer());
  EXPECT_TRUE(a.isEmpty() && m.isEmpty());
  EXPECT_EQ(a.type_trait<PObject::Array>(), 1);
  EXPECT_EQ(a.type_trait<std::string>(), 4);
}

TEST(PObjectConversions, MinusOneThroughEveryWidth) {
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
}

TEST(PObjectConversions, StringOfWideIntegerPrintsLow32Bits) {
  PObject o(4294967297ull);
  EXPECT_EQ(o.asString(), "1");
  EXPECT_EQ(o.toString(), "4294967297");
  EXPECT_EQ(PObject(4294967296ull).asString(), "0");
}

TEST(PObjectConversions, AssignmentsFromUnsignedAndBool) {
  PObject o;
  o = 4000000000u;
  EXPECT_EQ(o.asUInt64(), 4000000000ull);
  o = true;
  EXPECT_EQ(o.asUInt64(), 1u);
  o = false;
  EXPECT_TRUE(o.isInteger());
  EXPECT_EQ(o.asUInt64(), 0u);
}

TEST(PObjectConversions, WrongKindGivesZeroOrEmpty) {
  PObject s("42");
  EXPECT_EQ(s.asUInt64(), 0u);
  EXPECT_EQ(s.asInt32(), 0);
  const PObject& cs = s;
  EXPECT_EQ(&cs.asMap(), &PObject::GetEmptyMap());
  EXPECT_EQ(&cs.asArray(), &PObject::GetEmptyArray());
  EXPECT_TRUE(s.isString());  // const views leave the value alone
  PObject m;
  m["k"] = "v";
  EXPECT_EQ(m.asString(), "");
}

TEST(PObjectConversions, AsBoolOfStringsAndContainers) {
  EXPECT_TRUE(PObject("false").asBool());
  EXPECT_TRUE(PObject("0").asBool());
  EXPECT_FALSE(PObject("").asBool());
  PObject a;
  a.asArray();
  EXPECT_FALSE(a.asBool());
  a.asArray().emplace_back();
  EXPECT_TRUE(a.asBool());
}

TEST(PObjectConversions, NonConstContainerViewsReplaceTheValue) {
  PObject o("text");
  o.asArray().emplace_back("x");
  EXPECT_TRUE(o.isArray());
  EXPECT_EQ(o.asArray().size(), 1u);
  o.asMap()["k"] = 1u;
  EXPECT_TRUE(o.isMap());
  EXPECT_EQ(o.asMap().size(), 1u);
}

TEST(PObjectIndex, StringKeyConstVersusNonConst) {
  PObject o = Int(7);
  const PObject& c = o;
  EXPECT_TRUE(c["k"].isNull());
  EXPECT_TRUE(o.isInteger());
  EXPECT_TRUE(o["k"].isNull());
  EXPECT_TRUE(o.isMap());
  EXPECT_TRUE(o.hasMember("k"));
  EXPECT_EQ(o.asMap().size(), 1u);

  PObject arr;
  arr.asArray().emplace_back("x");
  arr["k"] = "v";
  EXPECT_TRUE(arr.isMap());
  EXPECT_EQ(arr.asMap().size(), 1u);
}

TEST(PObjectIndex, MissingConstMemberIsSharedNull) {
  PObject m;
  m["a"] = 1u;
  const PObject& c = m;
  EXPECT_EQ(&c["zz"], &PObject::GetEmptyObject());
  EXPECT_EQ(c["a"].asUInt64(), 1u);
}

TEST(PObjectIndex, NumericIndexOnArrays) {
  PObject a;
  a.asArray().emplace_back("only");
  const PObject& c = a;
  EXPECT_EQ(c[0u].asString(), "only");
  EXPECT_TRUE(c[5u].isNull());
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
  EXPECT_TRUE(c[100u].isNull());
  m[1u] = 20u;
  EXPECT_EQ(m["b"].asUInt64(), 20u);
  EXPECT_THROW(m[3u], std::out_of_range);
  PObject s("x");
  EXPECT_THROW(s[0u], std::out_of_range);
  PObject n;
  EXPECT_THROW(n[0u], std::out_of_range);
  EXPECT_TRUE(static_cast<const PObject&>(s)[0u].isNull());
}

TEST(PObjectCopy, SelfAssignmentLeavesNull) {
  PObject a("value");
  PObject& alias = a;
  a = alias;
  EXPECT_TRUE(a.isNull());
  EXPECT_EQ(a.typeCode(), 0);
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

TEST(PObjectCopy, CopyFromNullLeavesNull) {
  PObject target("old");
  PObject null;
  target = null;
  EXPECT_TRUE(target.isNull());
}

TEST(PObjectCopy, SwapExchangesWithoutCopying) {
  PObject a("left"), b(2ull);
  a.swap(b);
  EXPECT_EQ(a.asUInt64(), 2u);
  EXPECT_EQ(b.asString(), "left");
}

TEST(PObjectCopy, StringsMoveInAndAreReadInPlace) {
  std::string big(1000, 'm');
  const char* bytes = big.data();
  PObject p;
  p["x"] = 1ull;
  p = std::move(big);
  ASSERT_TRUE(p.isString());
  EXPECT_EQ(p.asStringRef().data(), bytes);  // taken over, not copied
  EXPECT_EQ(p.asStringRef(), std::string(1000, 'm'));
  EXPECT_EQ(PObject(7ull).asStringRef(), "");
  EXPECT_EQ(PObject().asStringRef(), "");
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
      PObject::Array& arr = cur->asArray();
      arr.emplace_back();
      cur = &arr.back();
    }
  }
  *cur = "leaf";
  PObject copy(root);
  const PObject* walk = &copy;
  int depth = 0;
  while (walk->isContainer()) {
    walk = walk->isMap() ? &walk->asMap().begin()->second : &walk->asArray()[0];
    ++depth;
  }
  EXPECT_EQ(depth, kDepth);
  EXPECT_EQ(walk->asString(), "leaf");
  root.clear();
  EXPECT_TRUE(root.isNull());
}

}  // namespace
