// The property-list value type: kinds, copies, dictionary order and descriptions.
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "base/plist.h"
#include "plist_test_util.h"

namespace brisvale::plist {
namespace {

TEST(PlistValue, DescriptionOfEachKind) {
  const struct {
    Value value;
    const char* text;
  } cases[] = {
      {Value("plain text"), "plain text"},
      {Value::Int(-42), "-42"},
      {Value::Int(std::numeric_limits<int64_t>::min()), "-9223372036854775808"},
      {Value::UInt(std::numeric_limits<uint64_t>::max()), "18446744073709551615"},
      {Value::Bool(true), "true"},
      {Value::Bool(false), "false"},
      {Value(Bytes{0x0a, 0x1b, 0xff}), "<0a1bff>"},
      {Value(Bytes{}), "<>"},
      {Value::Real(0.5), "0.5"},
      {Value(Date{418863330}), "2014-04-10T22:55:30Z"},
      {Value(Date{-0.5}), "2000-12-31T23:59:59Z"},  // floored, not rounded toward zero
      {Value(Array{}), "[]"},
      {Value(Array{Value("a"), Value::Int(1)}), "[a, 1]"},
      {Value(Dictionary{{"Key", Value("value")}, {"Key2", Value(Array{Value::Bool(true)})}}),
       "{Key: value, Key2: [true]}"},
      {Value(), "{}"},
  };
  for (const auto& c : cases) EXPECT_EQ(c.value.description(), c.text);
  EXPECT_EQ(Describe(nullptr), "(null)");
  Value text("x");
  EXPECT_EQ(Describe(&text), "x");
}

TEST(PlistValue, EqualityIsByValue) {
  const Value ab(Dictionary{{"a", Value::Int(1)}, {"b", Value("2")}});
  const Value ba(Dictionary{{"b", Value("2")}, {"a", Value::Int(1)}});
  EXPECT_EQ(ab, ba);
  EXPECT_NE(ab, Value(Dictionary{{"a", Value::Int(1)}, {"c", Value("2")}}));
  EXPECT_NE(ab, Value(Dictionary{{"a", Value::Int(1)}}));
  // Same numbers in different kinds are different values.
  EXPECT_NE(Value::Int(1), Value::Real(1));
  EXPECT_NE(Value::Int(1), Value::Bool(true));
  EXPECT_NE(Value("ab"), Value(Bytes{'a', 'b'}));
  // An unsigned integer that fits in int64 is the same value as the signed one.
  EXPECT_EQ(Value::UInt(7), Value::Int(7));
  EXPECT_EQ(Value(Integer{7, true}), Value::Int(7));
  EXPECT_FALSE(Value::UInt(7).integer()->isUnsigned);
  EXPECT_TRUE(Value::UInt(uint64_t{1} << 63).integer()->isUnsigned);
}

TEST(PlistValue, DictionaryKeepsOrderAndReplacesInPlace) {
  Dictionary d{{"z", Value::Int(1)}, {"a", Value::Int(2)}};
  d.set("z", Value::Int(3));
  d.set("m", Value::Int(4));
  std::string order;
  for (const auto& [key, value] : d) order += key + value.description();
  EXPECT_EQ(order, "z3a2m4");
  EXPECT_TRUE(d.erase("a"));
  EXPECT_FALSE(d.erase("a"));
  EXPECT_EQ(d.size(), 2u);
}

TEST(PlistValue, CopiesAreIndependentOfTheShared) {
  const Value original(Dictionary{{"Status", Value("Failure")}});
  Dictionary changed = *original.dictionary();
  changed.set("Status", Value("Success"));
  const Value updated(std::move(changed));
  EXPECT_EQ(*original.getString("Status"), "Failure");
  EXPECT_EQ(*updated.getString("Status"), "Success");
  EXPECT_EQ(original.getString("Missing"), nullptr);
  EXPECT_EQ(Value::Int(1).get("Status"), nullptr);
}

TEST(PlistValue, FromEntriesRefusesDuplicateKeys) {
  std::vector<Dictionary::Entry> small{{"a", Value::Int(1)}, {"a", Value::Int(2)}};
  EXPECT_FALSE(Dictionary::FromEntries(small));
  std::vector<Dictionary::Entry> large;
  for (int i = 0; i < 100; ++i) large.emplace_back("k" + std::to_string(i), Value::Int(i));
  EXPECT_TRUE(Dictionary::FromEntries(large));
  large.emplace_back("k57", Value::Int(0));
  EXPECT_FALSE(Dictionary::FromEntries(large));
}

}  // namespace
}  // namespace brisvale::plist
