#include "ipc/pobject.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <stdexcept>
#include <utility>

namespace {

PObject Nested() {  // {"a": [1, "b"], "c": null}
  PObject v;
  v["a"].asArray().push_back(PObject(uint64_t{1}));
  v["a"].asArray().push_back("b");
  v["c"];
  return v;
}

// What the non-const index throws for anything but an existing map entry.
const auto kOutOfRange =
    testing::ThrowsMessage<std::out_of_range>(testing::StrEq("out_of_range: PObject::operator[]"));

TEST(PObjectIntegers, AssignmentsExtendBySignednessAndReadersTruncate) {
  PObject v;
  v = -1;
  EXPECT_EQ(v.asUInt64(), UINT64_MAX);
  v = 0xFFFFFFFFu;
  EXPECT_EQ(v.asUInt64(), 0xFFFFFFFFull);
  EXPECT_EQ(v.asInt32(), -1);
  v = -2L;
  EXPECT_EQ(v.asInt64(), -2);
  EXPECT_EQ(PObject("12").asUInt64(), 0u);  // no parsing of strings
  // The integer lives in the payload word: 0 is a value, not null, and it
  // moves, copies and swaps like any other.
  v = 0;
  EXPECT_TRUE(v.isInteger() && !v.isNull() && !v.isEmpty());
  PObject moved(std::move(v)), copied(moved), other("x");
  EXPECT_TRUE(v.isNull() && moved.isInteger() && copied.isInteger() && copied.asUInt64() == 0);
  other.swap(moved);
  EXPECT_TRUE(other.isInteger() && moved.asString() == "x");
  other = "text";  // replacing an integer releases nothing it does not own
  EXPECT_EQ(other.toString(), "\"text\"");
}

TEST(PObjectReaders, AsStringAsBoolAndIsEmptyFollowTheKind) {
  EXPECT_EQ(PObject(uint64_t{0x100000001}).asString(), "1");
  EXPECT_TRUE(!PObject("").asBool() && PObject("0").asBool());
  EXPECT_TRUE(PObject(uint64_t{0x100000000}).asBool());  // the full 64 bits count
  EXPECT_TRUE(PObject().isEmpty() && !PObject().asBool());
  EXPECT_FALSE(PObject(uint64_t{0}).isEmpty() || PObject(uint64_t{0}).asBool());
  PObject v;
  v = PObject::binary_type{10, 20, ""};
  EXPECT_TRUE(v.isEmpty());  // a binary without path, whatever its section
  v = PObject::array_type{};
  EXPECT_TRUE(v.isArray() && !v.isNull() && v.isEmpty());
}

TEST(PObjectSubscript, ConstKeyAccessChangesNothingButNonConstMakesAMap) {
  const PObject integer(uint64_t{7});
  EXPECT_EQ(&integer["x"], &PObject::empty_object);
  EXPECT_EQ(&integer[0], &PObject::empty_object);
  const PObject map = Nested();
  EXPECT_TRUE(map.hasMember("c") && !map.hasMember("A"));
  EXPECT_EQ(&map["missing"], &PObject::empty_object);
  EXPECT_EQ(map.asMap().size(), 2u);  // const lookups insert nothing
  PObject v(uint64_t{7});
  EXPECT_THAT([&] { v[0]; }, kOutOfRange);
  EXPECT_TRUE(v["x"].isNull());
  EXPECT_EQ(v.toString(), "{\"x\": null}");
}

TEST(PObjectSubscript, IndexReachesArrayElementsAndMapEntriesInKeyOrder) {
  PObject array;
  array.asArray() = {"first", "second"};
  const PObject& carray = array;
  EXPECT_EQ(carray[0].asString(), "first");
  EXPECT_TRUE(carray[2].isNull() && carray[-1].isNull());
  EXPECT_THAT([&] { array[0]; }, kOutOfRange);  // only const access reaches array elements
  // Keys compare as unsigned bytes: upper case, lower case, then UTF-8 lead bytes.
  PObject map;
  map["\xC3\xA9"] = 3;
  map["a"] = 2;
  map["B"] = 1;
  const PObject& cmap = map;
  EXPECT_EQ(cmap[0].asUInt64(), 1u);
  EXPECT_TRUE(cmap[3].isNull() && cmap[-1].isNull());
  map[1] = "changed";
  EXPECT_EQ(map.toString(), "{\"B\": 1, \"a\": \"changed\", \"\xC3\xA9\": 3}");
  EXPECT_THAT([&] { map[3]; }, kOutOfRange);
}

TEST(PObjectCopy, CopiesAreDeepAndIndependent) {
  PObject original = Nested();
  original["buf"].asBuffer().assign("xyz", 3);
  PObject copy(original);
  copy["a"].asArray()[1] = "changed";
  copy["buf"].asBuffer().data[0] = 'X';
  EXPECT_EQ(original["a"].asArray()[1].asString(), "b");
  EXPECT_EQ(original["buf"].asBuffer().data[0], 'x');
}

TEST(PObjectCopy, SelfAssignmentNullsWhileMemberAssignmentWorks) {
  PObject v = Nested();
  PObject& alias = v;
  v = alias;
  EXPECT_TRUE(v.isNull());
  v = Nested();
  v = v["a"];  // the source lives inside the target
  EXPECT_EQ(v.toString(), "[1, \"b\"]");
  v = Nested();
  v = std::move(v["a"]);
  EXPECT_EQ(v.toString(), "[1, \"b\"]");
}

TEST(PObjectToString, RendersBinariesAndStringsAsTheyAre) {
  PObject v;
  v = PObject::binary_type{0, 4096, "/tmp/x"};
  EXPECT_EQ(v.toString(), "{offset: 0, length: 4096, path: \"/tmp/x\"}");
  v = "say \"hi\"";
  EXPECT_EQ(v.toString(), "\"say \"hi\"\"");  // nothing is escaped
}

}  // namespace
