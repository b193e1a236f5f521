#include "S2S/pobject.h"

#include <gtest/gtest.h>

#include <stdexcept>

namespace {

using S2S::PObject;

// Reading a value as any kind never fails; these are the answers.
TEST(PObject, EveryKindThroughEveryView) {
  PObject empty_array, array_of_null, empty_map;
  empty_array.asArray();
  array_of_null.asArray().emplace_back();
  empty_map.asMap();
  const struct {
    PObject value;
    int type;
    bool empty, as_bool;
    const char *as_string, *rendered;
  } cases[] = {
      {PObject(), 0, true, false, "", "null"},
      {PObject(0ull), 3, false, false, "0", "0"},  // an integer is never empty
      // A string of an integer holds its low 32 bits only.
      {PObject(4294967297ull), 3, false, true, "1", "4294967297"},
      {PObject(""), 4, true, false, "", "\"\""},
      {PObject("0"), 4, false, true, "0", "\"0\""},
      // Nothing is escaped.
      {PObject("say \"hi\"\n"), 4, false, true, "say \"hi\"\n",
       "\"say \"hi\"\n\""},
      {empty_array, 1, true, false, "", "[]"},
      {array_of_null, 1, false, true, "", "[null]"},
      {empty_map, 2, true, false, "", "{}"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.rendered);
    EXPECT_EQ(c.value.typeCode(), c.type);
    EXPECT_EQ(c.value.isEmpty(), c.empty);
    EXPECT_EQ(c.value.asBool(), c.as_bool);
    EXPECT_EQ(c.value.asString(), c.as_string);
    EXPECT_EQ(c.value.toString(), c.rendered);
  }
}

TEST(PObject, IntegersAreSixtyFourBitsSeenThroughNarrowerViews) {
  PObject o;
  o = -1;  // sign-extended
  EXPECT_EQ(o.asUInt64(), 18446744073709551615ull);
  EXPECT_EQ(o.asInt32(), -1);
  EXPECT_EQ(o.asUInt16(), 65535);
  EXPECT_EQ(o.toString(), "18446744073709551615");
  o = 4000000000u;  // zero-extended
  EXPECT_EQ(o.asUInt64(), 4000000000ull);
  EXPECT_EQ(PObject("42").asUInt64(), 0u);  // no string-to-number conversion
}

// Const views of another kind give shared empties; non-const ones replace.
TEST(PObject, ConstViewsReadAndNonConstViewsReplace) {
  PObject o(7ull);
  const PObject& c = o;
  EXPECT_EQ(&c.asMap(), &PObject::GetEmptyMap());
  EXPECT_EQ(&c.asArray(), &PObject::GetEmptyArray());
  EXPECT_EQ(&c["k"], &PObject::GetEmptyObject());
  EXPECT_EQ(c.asStringRef(), "");
  EXPECT_TRUE(o.isInteger());
  o.asArray().emplace_back("x");
  EXPECT_TRUE(o["k"].isNull());  // the array gives way to a map
  EXPECT_TRUE(o.isMap() && o.hasMember("k"));
  EXPECT_EQ(o.asMap().size(), 1u);
  o["a"] = 1u;
  EXPECT_EQ(c["a"].asUInt64(), 1u);
  EXPECT_EQ(&c["zz"], &PObject::GetEmptyObject());
}

TEST(PObject, NumericIndexWalksMapsInKeyOrderAndNeverWritesArrays) {
  PObject m;
  m["b"] = 2u;
  m["a"] = 1u;
  m["c"] = 3u;
  const PObject& cm = m;
  EXPECT_EQ(cm[0u].asUInt64(), 1u);
  EXPECT_EQ(cm[2u].asUInt64(), 3u);
  EXPECT_TRUE(cm[3u].isNull());
  m[1u] = 20u;
  EXPECT_EQ(m["b"].asUInt64(), 20u);
  EXPECT_THROW(m[3u], std::out_of_range);

  PObject a, s("x"), n;
  a.asArray().emplace_back("only");
  const PObject &ca = a, &cs = s;
  EXPECT_EQ(ca[0u].asString(), "only");
  EXPECT_TRUE(ca[5u].isNull());
  EXPECT_TRUE(cs[0u].isNull());
  EXPECT_THROW(a[0u], std::out_of_range);
  EXPECT_THROW(s[0u], std::out_of_range);
  EXPECT_THROW(n[0u], std::out_of_range);
}

TEST(PObject, CopiesAreDeepAndSelfAssignmentLeavesNull) {
  PObject src;
  src["list"].asArray().emplace_back("x");
  src["nested"]["inner"] = 5u;
  PObject copy(src);
  copy["nested"]["inner"] = 6u;
  copy["list"].asArray().emplace_back("y");
  EXPECT_EQ(src.toString(), "{\"list\": [\"x\"], \"nested\": {\"inner\": 5}}");
  PObject assigned;
  assigned = src;
  src.clear();
  EXPECT_TRUE(src.isNull());
  EXPECT_EQ(assigned["nested"]["inner"].asUInt64(), 5u);

  PObject& alias = assigned;
  assigned = alias;  // cleared before the copy, by definition
  EXPECT_TRUE(assigned.isNull());
  // A value taken from the object itself is safe on the typed path.
  PObject s("value"), m;
  s = s.asString();
  EXPECT_EQ(s.asString(), "value");
  m["k"] = "v";
  m = m.asMap();
  EXPECT_EQ(m["k"].asString(), "v");
}

// Containers are built, copied and destroyed without recursion.
TEST(PObject, HundredsOfThousandsOfLevelsBuildCopyAndDestroy) {
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
  for (; walk->isContainer(); ++depth)
    walk = walk->isMap() ? &walk->asMap().begin()->second : &walk->asArray()[0];
  EXPECT_EQ(depth, kDepth);
  EXPECT_EQ(walk->asString(), "leaf");
  root.clear();
  EXPECT_TRUE(root.isNull());
}

}  // namespace
