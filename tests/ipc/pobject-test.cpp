#include "ipc/pobject.h"

#include <gtest/gtest.h>

#include <cstring>
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

// The tags travel on the wire, so they must not drift.
static_assert(PObject::type_trait<PObject::array_type>::value == 1);
static_assert(PObject::type_trait<PObject::map_type>::value == 2);
static_assert(PObject::type_trait<uint64_t>::value == 3);
static_assert(PObject::type_trait<std::string>::value == 4);
static_assert(PObject::type_trait<PObject::binary_type>::value == 5);
static_assert(PObject::type_trait<PObject::buffer_type>::value == 6);

TEST(PObjectIntegers, AssignmentsExtendBySignednessAndReadersTruncate) {
  PObject v;
  v = -1;
  EXPECT_TRUE(v.isInteger());
  EXPECT_EQ(v.asUInt64(), UINT64_MAX);
  v = 0xFFFFFFFFu;
  EXPECT_EQ(v.asUInt64(), 0xFFFFFFFFull);
  EXPECT_EQ(v.asInt32(), -1);
  v = -2L;
  EXPECT_EQ(v.asInt64(), -2);
  v = true;
  EXPECT_EQ(v.asUInt64(), 1u);
  v = 0xFFFFFFFF00000005ul;
  EXPECT_EQ(v.asInt32(), 5);
  EXPECT_EQ(v.asInteger(), static_cast<int64_t>(0xFFFFFFFF00000005ull));
  v = 0x1FF;
  EXPECT_EQ(v.asUInt8(), 0xFF);
  EXPECT_EQ(v.asInt8(), -1);
  EXPECT_EQ(PObject("12").asUInt64(), 0u);  // no parsing of strings
}

TEST(PObjectReaders, AsStringAsBoolAndIsEmptyFollowTheKind) {
  EXPECT_EQ(PObject(uint64_t{0x100000001}).asString(), "1");
  EXPECT_EQ(Nested().asString(), "");
  EXPECT_FALSE(PObject("").asBool());
  EXPECT_TRUE(PObject("0").asBool());
  EXPECT_FALSE(PObject(uint64_t{0}).asBool());
  EXPECT_TRUE(PObject(uint64_t{0x100000000}).asBool());  // the full 64 bits count
  EXPECT_FALSE(PObject().asBool());

  EXPECT_TRUE(PObject().isEmpty());
  EXPECT_FALSE(PObject(uint64_t{0}).isEmpty());
  PObject v;
  v = PObject::binary_type{10, 20, ""};
  EXPECT_TRUE(v.isBinary() && v.isPrimitive() && v.isEmpty());
  v.asBinary().path = "/x";
  EXPECT_FALSE(v.isEmpty());
  v = PObject::array_type{};
  EXPECT_TRUE(v.isArray() && v.isContainer() && !v.isNull() && v.isEmpty());
}

TEST(PObjectReaders, ConstAccessOfOtherKindsYieldsSharedEmptiesWithoutChange) {
  const PObject integer(uint64_t{7});
  EXPECT_EQ(&integer["x"], &PObject::empty_object);
  EXPECT_EQ(&integer[0], &PObject::empty_object);
  EXPECT_EQ(&integer.asMap(), &PObject::empty_map);
  EXPECT_FALSE(integer.hasMember("x"));
  EXPECT_EQ(integer.asUInt64(), 7u);

  const PObject map = Nested();
  EXPECT_TRUE(map.hasMember("c"));
  EXPECT_FALSE(map.hasMember("A"));
  EXPECT_TRUE(map["c"].isNull());
  EXPECT_EQ(&map["missing"], &PObject::empty_object);
  EXPECT_EQ(map.asMap().size(), 2u);  // const lookups insert nothing
}

TEST(PObjectSubscript, NonConstKeyTurnsValueIntoMap) {
  PObject v(uint64_t{7});
  EXPECT_TRUE(v["x"].isNull());
  EXPECT_EQ(v.toString(), "{\"x\": null}");
  v = "text";
  v.asArray().push_back("a");
  EXPECT_EQ(v.toString(), "[\"a\"]");
}

TEST(PObjectSubscript, IndexReachesArrayElementsAndMapEntriesInKeyOrder) {
  PObject array;
  array = PObject::array_type{PObject("first"), PObject("second")};
  const PObject& carray = array;
  EXPECT_EQ(carray[0].asString(), "first");
  EXPECT_TRUE(carray[2].isNull());
  EXPECT_TRUE(carray[-1].isNull());
  try {
    array[0];
    FAIL() << "non-const index on an array must throw";
  } catch (const std::out_of_range& e) {
    EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
  }

  // Keys compare as unsigned bytes: upper case, lower case, then UTF-8 lead bytes.
  PObject map;
  map["\xC3\xA9"] = 3;
  map["a"] = 2;
  map["B"] = 1;
  const PObject& cmap = map;
  EXPECT_EQ(cmap[0].asUInt64(), 1u);
  EXPECT_EQ(cmap[2].asUInt64(), 3u);
  EXPECT_TRUE(cmap[3].isNull());
  EXPECT_TRUE(cmap[-1].isNull());
  map[1] = "changed";
  EXPECT_EQ(map.toString(), "{\"B\": 1, \"a\": \"changed\", \"\xC3\xA9\": 3}");
  EXPECT_THROW(map[3], std::out_of_range);
  EXPECT_THROW(map[-1], std::out_of_range);
  PObject integer(uint64_t{1});
  EXPECT_THROW(integer[0], std::out_of_range);
  EXPECT_TRUE(integer.isInteger());
}

TEST(PObjectCopy, CopiesAreDeepAndIndependent) {
  PObject original = Nested();
  original["buf"].asBuffer().assign("xyz", 3);
  PObject copy(original);
  copy["a"].asArray()[1] = "changed";
  copy["buf"].asBuffer().data[0] = 'X';
  EXPECT_EQ(original["a"].asArray()[1].asString(), "b");
  EXPECT_NE(original["buf"].asBuffer().data, copy["buf"].asBuffer().data);
  EXPECT_EQ(original["buf"].asBuffer().data[0], 'x');
}

TEST(PObjectCopy, SelfAssignmentNullsWhileMemberAssignmentWorks) {
  PObject v = Nested();
  PObject& alias = v;
  v = alias;
  EXPECT_TRUE(v.isNull());
  v = Nested();
  v.copy(v);
  EXPECT_TRUE(v.isNull());

  v = Nested();
  v = v["a"];  // the source lives inside the target
  EXPECT_EQ(v.toString(), "[1, \"b\"]");
  v = Nested();
  v = std::move(v["a"]);
  EXPECT_EQ(v.toString(), "[1, \"b\"]");
}

TEST(PObjectCopy, SwapMoveAndClearTransferOrReleasePayload) {
  PObject a("a"), b = Nested();
  a.swap(b);
  EXPECT_TRUE(a.isMap() && b.asString() == "a");
  PObject moved(std::move(a));
  EXPECT_TRUE(a.isNull() && moved.isMap());
  moved.clear();
  EXPECT_TRUE(moved.isNull() && !moved.isMap());
}

TEST(PObjectBuffer, ReallocKeepsBlockOnlyWhileAtLeastHalfUsed) {
  PObject::buffer_type buf;
  ASSERT_EQ(buf.realloc_data(10), 0);
  EXPECT_EQ(buf.capacity, 10);
  char* block = buf.data;
  ASSERT_EQ(buf.realloc_data(5), 0);
  EXPECT_EQ(buf.data, block);
  EXPECT_EQ(buf.capacity, 10);
  ASSERT_EQ(buf.realloc_data(4), 0);
  EXPECT_EQ(buf.capacity, 4);
  ASSERT_EQ(buf.realloc_data(11), 0);
  EXPECT_EQ(buf.capacity, 11);
  ASSERT_EQ(buf.realloc_data(0), 0);
  EXPECT_EQ(buf.data, nullptr);
  EXPECT_EQ(buf.capacity, 0);
}

TEST(PObjectBuffer, AssignClearAndCopyLeaveNoStaleBytes) {
  PObject::buffer_type buf;
  ASSERT_EQ(buf.assign("0123456789", 10), 0);
  ASSERT_EQ(buf.assign("abcdef", 6), 0);  // block kept: 6 >= 10 / 2
  EXPECT_EQ(buf.capacity, 10);
  EXPECT_EQ(buf.length, 6);
  EXPECT_EQ(std::memcmp(buf.data, "abcdef\0\0\0\0", 10), 0);

  PObject::buffer_type copy;
  copy = buf;
  EXPECT_NE(copy.data, buf.data);
  EXPECT_EQ(copy.capacity, 6);
  EXPECT_EQ(std::memcmp(copy.data, "abcdef", 6), 0);
  PObject::buffer_type& same = copy;
  copy = same;
  EXPECT_EQ(std::memcmp(copy.data, "abcdef", 6), 0);

  buf.clear();
  EXPECT_TRUE(buf.empty());
  ASSERT_NE(buf.data, nullptr);
  EXPECT_EQ(std::memcmp(buf.data, "\0\0\0\0\0\0\0\0\0\0", 10), 0);
}

TEST(PObjectToString, RendersEveryKind) {
  EXPECT_EQ(Nested().toString(), "{\"a\": [1, \"b\"], \"c\": null}");
  EXPECT_EQ(PObject().toString(), "null");
  EXPECT_EQ(PObject(UINT64_MAX).toString(), "18446744073709551615");
  PObject v;
  v = PObject::binary_type{0, 4096, "/tmp/x"};
  EXPECT_EQ(v.toString(), "{offset: 0, length: 4096, path: \"/tmp/x\"}");
  v.asBuffer().assign("12345", 5);
  EXPECT_EQ(v.toString(), "{data_length: 5, }");
  v = "say \"hi\"";
  EXPECT_EQ(v.toString(), "\"say \"hi\"\"");  // nothing is escaped
  v = PObject::map_type{};
  EXPECT_EQ(v.toString(), "{}");
  v.asArray();
  EXPECT_EQ(v.toString(), "[]");
}

}  // namespace
