// Property-list values: the one value type for requests, replies, device entries,
// registry properties and job descriptions.
//
// A Value is cheap to copy: strings, data and containers are shared and immutable, the
// way the platform's reference-counted objects behave. To change a container, take a
// copy of it (Dictionary d = *value.dictionary();), change the copy and wrap it again.
// Equality is by value: text by its UTF-8 bytes, data by bytes, containers element by
// element (dictionaries ignore key order).
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace brisvale::plist {

class Value;

enum class Kind { Dictionary, Array, String, Data, Integer, Real, Boolean, Date };

using Bytes = std::vector<uint8_t>;
using Array = std::vector<Value>;

// A property-list integer: signed 64-bit, plus unsigned 64-bit for values above
// INT64_MAX (which the binary format writes as a 16-byte integer).
struct Integer {
  int64_t value = 0;
  bool isUnsigned = false;  // true only for values above INT64_MAX; then value holds the bits
  uint64_t asUnsigned() const { return static_cast<uint64_t>(value); }
  bool operator==(const Integer&) const = default;
};

// Seconds since 2001-01-01 00:00:00 UTC, as the formats store it.
struct Date {
  double secondsSinceReferenceDate = 0;
  bool operator==(const Date&) const = default;
};

// String keys in insertion order. Setting an existing key replaces its value in place.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);
  // The entries in their order; none when two of them share a key.
  static std::optional<Dictionary> FromEntries(std::vector<Entry> entries);

  const Value* find(std::string_view key) const;
  void set(std::string key, Value value);
  bool erase(std::string_view key);

  // Defined below Value: clang needs Value complete to instantiate these.
  size_t size() const;
  bool empty() const;
  std::vector<Entry>::const_iterator begin() const;
  std::vector<Entry>::const_iterator end() const;

  bool operator==(const Dictionary& other) const;

 private:
  std::vector<Entry> entries_;
};

class Value {
 public:
  Value();  // an empty dictionary
  Value(const char* text);
  Value(std::string text);
  Value(std::string_view text);
  Value(Bytes bytes);
  Value(Integer integer);
  Value(Date date);
  Value(Array array);
  Value(Dictionary dictionary);
  static Value Int(int64_t value) { return Value(Integer{value, false}); }
  static Value UInt(uint64_t value);
  static Value Real(double value);
  static Value Bool(bool value);

  Kind kind() const;

  // Typed views: nullptr (or none) when the value is of another kind.
  const std::string* string() const;
  const Bytes* data() const;
  const Array* array() const;
  const Dictionary* dictionary() const;
  std::optional<Integer> integer() const;
  std::optional<double> real() const;
  std::optional<bool> boolean() const;
  std::optional<Date> date() const;

  // Dictionary lookup; nullptr when this is not a dictionary or the key is missing.
  const Value* get(std::string_view key) const;
  // The string under key, or nullptr when missing or not a string.
  const std::string* getString(std::string_view key) const;

  // The text that "%@" prints: a string as itself, numbers in decimal, booleans
  // true/false, data as <0a1bff>, containers in a compact plist-like text.
  std::string description() const;
  // The same, stopped once it is longer than `limit` bytes: the text is then cut to at
  // most `limit` bytes (on a character boundary) and ends in kDescriptionCut. The walk
  // stops there too, so a huge value, or one shared a thousand times, costs no more.
  std::string description(size_t limit) const;

  bool operator==(const Value& other) const;

 private:
  struct Boolean {
    bool value;
    bool operator==(const Boolean&) const = default;
  };
  struct RealNumber {
    double value;
    bool operator==(const RealNumber&) const = default;
  };
  using Storage = std::variant<std::shared_ptr<const Dictionary>, std::shared_ptr<const Array>,
                               std::shared_ptr<const std::string>, std::shared_ptr<const Bytes>,
                               Integer, RealNumber, Boolean, Date>;
  explicit Value(Storage storage) : storage_(std::move(storage)) {}
  Storage storage_;
};

inline size_t Dictionary::size() const { return entries_.size(); }
inline bool Dictionary::empty() const { return entries_.empty(); }
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::begin() const {
  return entries_.begin();
}
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::end() const {
  return entries_.end();
}

inline constexpr std::string_view kDescriptionCut = "...<cut>";

// "%@" of a missing value.
std::string Describe(const Value* value);

// Codecs. Readers take untrusted bytes and never crash, hang or allocate without
// bound on malformed input; the limits are below. A top level of any kind is read:
// callers that need a dictionary check for one.
inline constexpr size_t kMaxObjects = 1 << 20;  // objects in one document
inline constexpr size_t kMaxDepth = 512;        // container nesting

enum class Format { Binary, Xml };

std::optional<Value> ReadBinary(std::span<const uint8_t> bytes, std::string* error = nullptr);
std::optional<Value> ReadXml(std::span<const uint8_t> bytes, std::string* error = nullptr);
// Either format, told apart by the "bplist00" magic.
std::optional<Value> Read(std::span<const uint8_t> bytes, std::string* error = nullptr,
                          Format* format = nullptr);

// Binary property list, format version 1.0 ("bplist00").
Bytes WriteBinary(const Value& value);
// XML property list with the standard header; dates to whole seconds.
std::string WriteXml(const Value& value);

}  // namespace brisvale::plist
