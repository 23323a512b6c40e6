// Binary property lists: "bplist00", a header, the objects, a table of object offsets
// and a 32-byte trailer. Objects refer to each other by index into the offset table.
#include <bit>
#include <cmath>
#include <cstring>
#include <limits>
#include <string_view>
#include <unordered_map>

#include "base/plist.h"
#include "base/plist_internal.h"
#include "base/utf8.h"

namespace brisvale::plist {
namespace {

constexpr std::string_view kMagic = "bplist00";
constexpr size_t kHeaderSize = 8;
constexpr size_t kTrailerSize = 32;

// Object markers: the high nibble is the kind, the low nibble a size or count.
enum Marker : uint8_t {
  kFalse = 0x08,
  kTrue = 0x09,
  kInt = 0x10,
  kReal = 0x20,
  kDate = 0x33,
  kData = 0x40,
  kAsciiString = 0x50,
  kUtf16String = 0x60,
  kArray = 0xA0,
  kDict = 0xD0,
};

// Shared objects may be referenced many times, so a small document can describe a
// huge tree. Consumers walk values as trees (descriptions, the XML writer), so the
// reader bounds the expanded tree, not only the objects stored.
constexpr uint64_t kMaxExpandedBytes = 64u << 20;

struct Expansion {
  uint32_t nodes = 0;
  uint32_t bytes = 0;
};

class BinaryReader {
 public:
  explicit BinaryReader(std::span<const uint8_t> bytes) : bytes_(bytes) {}

  std::optional<Value> Read(std::string* error) {
    const Value* top = ReadTrailer() ? ReadObject(topObject_, 0, nullptr) : nullptr;
    if (!top && error) *error = error_ ? error_ : "malformed binary property list";
    return top ? std::optional<Value>(*top) : std::nullopt;
  }

 private:
  bool Fail(const char* why) {
    if (!error_) error_ = why;
    return false;
  }

  // Big-endian unsigned integer of 1..8 bytes; the caller has checked the bounds.
  uint64_t Number(size_t at, size_t width) const {
    const uint8_t* p = bytes_.data() + at;
    switch (width) {
      case 1:
        return p[0];
      case 2:
        return uint64_t{p[0]} << 8 | p[1];
      case 4: {
        uint32_t n;
        std::memcpy(&n, p, 4);
        return __builtin_bswap32(n);
      }
      case 8: {
        uint64_t n;
        std::memcpy(&n, p, 8);
        return __builtin_bswap64(n);
      }
      default: {
        uint64_t n = 0;
        for (size_t i = 0; i < width; ++i) n = (n << 8) | p[i];
        return n;
      }
    }
  }

  bool ReadTrailer() {
    const size_t size = bytes_.size();
    if (size < kHeaderSize + kTrailerSize) return Fail("too short for a binary property list");
    if (std::memcmp(bytes_.data(), kMagic.data(), kMagic.size()) != 0) {
      return Fail("not a binary property list (version 00)");
    }
    const size_t trailer = size - kTrailerSize;
    offsetSize_ = bytes_[trailer + 6];
    refSize_ = bytes_[trailer + 7];
    const uint64_t count = Number(trailer + 8, 8);
    const uint64_t top = Number(trailer + 16, 8);
    const uint64_t table = Number(trailer + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) {
      return Fail("bad integer size in trailer");
    }
    if (count == 0 || count > kMaxObjects) return Fail("object count out of range");
    if (top >= count) return Fail("top object out of range");
    if (table < kHeaderSize || table > trailer || (trailer - table) / offsetSize_ < count) {
      return Fail("offset table out of bounds");
    }
    objectCount_ = static_cast<size_t>(count);
    topObject_ = static_cast<size_t>(top);
    offsetTable_ = static_cast<size_t>(table);
    // The count now provably fits in the buffer, so these allocations are bounded by it.
    values_.resize(objectCount_);
    expansions_.resize(objectCount_);
    states_.resize(objectCount_, State::Unread);
    return true;
  }

  // The value of object `index` (read once, then shared), adding its expanded size to
  // *parent; nullptr on failure.
  const Value* ReadObject(size_t index, size_t depth, Expansion* parent) {
    switch (states_[index]) {
      case State::InProgress:
        Fail("object refers to itself");
        return nullptr;
      case State::Done:
        break;
      case State::Unread: {
        states_[index] = State::InProgress;
        const uint64_t offset = Number(offsetTable_ + index * offsetSize_, offsetSize_);
        if (offset < kHeaderSize || offset >= offsetTable_) {
          Fail("object offset out of bounds");
          return nullptr;
        }
        Expansion expansion{1, 0};
        if (!ParseObject(static_cast<size_t>(offset), depth, values_[index], expansion)) {
          return nullptr;
        }
        expansions_[index] = expansion;
        states_[index] = State::Done;
        break;
      }
    }
    if (parent) {
      parent->nodes += expansions_[index].nodes;
      parent->bytes += expansions_[index].bytes;
      if (parent->nodes > kMaxObjects || parent->bytes > kMaxExpandedBytes) {
        Fail("document expands beyond the object limit");
        return nullptr;
      }
    }
    return &*values_[index];
  }

  // A count from the low nibble, or from the integer object that follows when the
  // nibble is 0xF. Leaves cursor after the count.
  bool ReadCount(size_t& cursor, uint8_t nibble, uint64_t& count) {
    if (nibble != 0xF) {
      count = nibble;
      return true;
    }
    if (cursor >= offsetTable_) return Fail("truncated count");
    const uint8_t marker = bytes_[cursor++];
    if ((marker & 0xF0) != kInt || (marker & 0x0F) > 3) return Fail("bad count");
    const size_t width = size_t{1} << (marker & 0x0F);
    if (offsetTable_ - cursor < width) return Fail("truncated count");
    count = Number(cursor, width);
    cursor += width;
    return true;
  }

  // Checks that count items of unit bytes fit between cursor and the offset table.
  bool Fits(size_t cursor, uint64_t count, size_t unit) const {
    return count <= (offsetTable_ - cursor) / unit;
  }

  // The object that the reference at `at` names, or none when out of range.
  std::optional<size_t> Ref(size_t at) {
    const uint64_t ref = Number(at, refSize_);
    if (ref >= objectCount_) {
      Fail("object reference out of range");
      return std::nullopt;
    }
    return static_cast<size_t>(ref);
  }

  bool ParseObject(size_t offset, size_t depth, std::optional<Value>& out,
                   Expansion& expansion) {
    size_t cursor = offset + 1;
    const uint8_t marker = bytes_[offset];
    const uint8_t nibble = marker & 0x0F;
    switch (marker & 0xF0) {
      case 0x00:
        if (marker != kFalse && marker != kTrue) return Fail("unsupported object");
        out = Value::Bool(marker == kTrue);
        return true;
      case kInt:
        return ParseInteger(cursor, nibble, out);
      case kReal: {
        if (nibble != 2 && nibble != 3) return Fail("bad real size");
        const size_t width = size_t{1} << nibble;
        if (!Fits(cursor, width, 1)) return Fail("truncated real");
        if (width == 4) {
          out = Value::Real(std::bit_cast<float>(static_cast<uint32_t>(Number(cursor, 4))));
        } else {
          out = Value::Real(std::bit_cast<double>(Number(cursor, 8)));
        }
        return true;
      }
      case kDate & 0xF0:
        if (marker != kDate) return Fail("bad date");
        if (!Fits(cursor, 8, 1)) return Fail("truncated date");
        if (double seconds = std::bit_cast<double>(Number(cursor, 8)); std::isfinite(seconds)) {
          out = Value(Date{seconds});
          return true;
        }
        return Fail("date is not a number");
      case kData: {
        uint64_t length;
        if (!ReadCount(cursor, nibble, length)) return false;
        if (!Fits(cursor, length, 1)) return Fail("data out of bounds");
        out = Value(Bytes(bytes_.begin() + cursor, bytes_.begin() + cursor + length));
        expansion.bytes = static_cast<uint32_t>(std::min<uint64_t>(length, kMaxExpandedBytes + 1));
        return expansion.bytes <= kMaxExpandedBytes || Fail("data too large");
      }
      case kAsciiString:
      case kUtf16String: {
        uint64_t length;
        if (!ReadCount(cursor, nibble, length)) return false;
        const size_t unit = (marker & 0xF0) == kAsciiString ? 1 : 2;
        if (!Fits(cursor, length, unit)) return Fail("string out of bounds");
        std::string text;
        if (unit == 1) {
          uint8_t highBits = 0;  // one OR over the bytes: the loop vectorizes
          for (size_t i = 0; i < length; ++i) highBits |= bytes_[cursor + i];
          if (highBits & 0x80) return Fail("non-ASCII byte in ASCII string");
          text.assign(reinterpret_cast<const char*>(bytes_.data() + cursor), length);
        } else if (!DecodeUtf16(cursor, static_cast<size_t>(length), text)) {
          return Fail("invalid UTF-16 string");
        }
        expansion.bytes = static_cast<uint32_t>(std::min<size_t>(text.size(), kMaxExpandedBytes + 1));
        if (expansion.bytes > kMaxExpandedBytes) return Fail("string too large");
        out = Value(std::move(text));
        return true;
      }
      case kArray:
      case kDict:
        return ParseContainer(cursor, marker, depth, out, expansion);
      default:
        return Fail("unsupported object");
    }
  }

  bool ParseInteger(size_t cursor, uint8_t nibble, std::optional<Value>& out) {
    if (nibble > 4) return Fail("bad integer size");
    const size_t width = size_t{1} << nibble;
    if (!Fits(cursor, width, 1)) return Fail("truncated integer");
    if (width < 8) {
      out = Value::Int(static_cast<int64_t>(Number(cursor, width)));
    } else if (width == 8) {
      out = Value::Int(static_cast<int64_t>(Number(cursor, 8)));
    } else {
      // 128-bit signed: only values that fit in 64 bits (either sign) are kept.
      const uint64_t high = Number(cursor, 8);
      const uint64_t low = Number(cursor + 8, 8);
      const bool lowNegative = static_cast<int64_t>(low) < 0;
      if (high == 0) {
        out = Value::UInt(low);
      } else if (high == std::numeric_limits<uint64_t>::max() && lowNegative) {
        out = Value::Int(static_cast<int64_t>(low));
      } else {
        return Fail("integer out of range");
      }
    }
    return true;
  }

  bool DecodeUtf16(size_t cursor, size_t units, std::string& text) {
    text.reserve(units);
    for (size_t i = 0; i < units; ++i) {
      char32_t unit = static_cast<char32_t>(Number(cursor + 2 * i, 2));
      if (unit >= 0xDC00 && unit <= 0xDFFF) return false;
      if (unit >= 0xD800 && unit <= 0xDBFF) {
        if (i + 1 == units) return false;
        const char32_t low = static_cast<char32_t>(Number(cursor + 2 * (i + 1), 2));
        if (low < 0xDC00 || low > 0xDFFF) return false;
        unit = 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00);
        ++i;
      }
      utf8::Append(text, unit);
    }
    return true;
  }

  bool ParseContainer(size_t cursor, uint8_t marker, size_t depth, std::optional<Value>& out,
                      Expansion& expansion) {
    if (depth >= kMaxDepth) return Fail("containers nested too deeply");
    const bool isDict = (marker & 0xF0) == kDict;
    uint64_t count;
    if (!ReadCount(cursor, marker & 0x0F, count)) return false;
    if (!Fits(cursor, count, refSize_ * (isDict ? 2 : 1))) return Fail("container out of bounds");
    const size_t n = static_cast<size_t>(count);
    if (!isDict) {
      Array elements;
      elements.reserve(n);
      for (size_t i = 0; i < n; ++i) {
        const std::optional<size_t> ref = Ref(cursor + i * refSize_);
        const Value* element = ref ? ReadObject(*ref, depth + 1, &expansion) : nullptr;
        if (!element) return false;
        elements.push_back(*element);
      }
      out = Value(std::move(elements));
      return true;
    }
    std::vector<Dictionary::Entry> entries;
    entries.reserve(n);
    for (size_t i = 0; i < n; ++i) {
      const std::optional<size_t> keyRef = Ref(cursor + i * refSize_);
      const Value* key = keyRef ? ReadObject(*keyRef, depth + 1, &expansion) : nullptr;
      if (!key) return false;
      if (!key->string()) return Fail("dictionary key is not a string");
      const std::optional<size_t> valueRef = Ref(cursor + (n + i) * refSize_);
      const Value* element = valueRef ? ReadObject(*valueRef, depth + 1, &expansion) : nullptr;
      if (!element) return false;
      entries.emplace_back(*key->string(), *element);
    }
    std::optional<Dictionary> dictionary = Dictionary::FromEntries(std::move(entries));
    if (!dictionary) return Fail("duplicate dictionary key");
    out = Value(std::move(*dictionary));
    return true;
  }

  enum class State : uint8_t { Unread, InProgress, Done };

  std::span<const uint8_t> bytes_;
  const char* error_ = nullptr;
  size_t offsetSize_ = 0;
  size_t refSize_ = 0;
  size_t objectCount_ = 0;
  size_t topObject_ = 0;
  size_t offsetTable_ = 0;
  std::vector<std::optional<Value>> values_;
  std::vector<Expansion> expansions_;
  std::vector<State> states_;
};

// Width in bytes (1, 2, 4 or 8) of an unsigned number.
size_t WidthFor(uint64_t n) {
  if (n <= 0xFF) return 1;
  if (n <= 0xFFFF) return 2;
  if (n <= 0xFFFFFFFF) return 4;
  return 8;
}

class BinaryWriter {
 public:
  Bytes Write(const Value& top) {
    Add(top);
    refSize_ = WidthFor(objects_.size() - 1);
    out_.assign(kMagic.begin(), kMagic.end());
    std::vector<uint64_t> offsets;
    offsets.reserve(objects_.size());
    for (const Object& object : objects_) {
      offsets.push_back(out_.size());
      Emit(object);
    }
    const uint64_t table = out_.size();
    const size_t offsetSize = WidthFor(offsets.back());
    for (uint64_t offset : offsets) Put(offset, offsetSize);
    out_.insert(out_.end(), 6, 0);
    out_.push_back(static_cast<uint8_t>(offsetSize));
    out_.push_back(static_cast<uint8_t>(refSize_));
    Put(objects_.size(), 8);
    Put(0, 8);
    Put(table, 8);
    return std::move(out_);
  }

 private:
  // A value, or a dictionary key (value == nullptr).
  struct Object {
    const Value* value;
    std::string_view key;
    size_t firstRef = 0;
    size_t refCount = 0;
  };

  size_t AddString(std::string_view text, const Value* value) {
    auto [it, inserted] = strings_.try_emplace(text, objects_.size());
    if (inserted) objects_.push_back(Object{value, text});
    return it->second;
  }

  size_t Add(const Value& value) {
    if (const std::string* text = value.string()) return AddString(*text, &value);
    const size_t index = objects_.size();
    objects_.push_back(Object{&value, {}});
    if (const Array* array = value.array()) {
      const size_t first = refs_.size();
      refs_.resize(first + array->size());
      objects_[index].firstRef = first;
      objects_[index].refCount = array->size();
      for (size_t i = 0; i < array->size(); ++i) refs_[first + i] = Add((*array)[i]);
    } else if (const Dictionary* dictionary = value.dictionary()) {
      const size_t n = dictionary->size();
      const size_t first = refs_.size();
      refs_.resize(first + 2 * n);
      objects_[index].firstRef = first;
      objects_[index].refCount = 2 * n;
      size_t i = 0;
      for (const auto& [key, element] : *dictionary) {
        refs_[first + i] = AddString(key, nullptr);
        refs_[first + n + i] = Add(element);
        ++i;
      }
    }
    return index;
  }

  void Put(uint64_t n, size_t width) {
    for (size_t i = width; i-- > 0;) out_.push_back(static_cast<uint8_t>(n >> (8 * i)));
  }

  void PutHeader(uint8_t marker, uint64_t count) {
    if (count < 15) {
      out_.push_back(static_cast<uint8_t>(marker | count));
      return;
    }
    out_.push_back(marker | 0x0F);
    const size_t width = WidthFor(count);
    out_.push_back(static_cast<uint8_t>(kInt | std::countr_zero(width)));
    Put(count, width);
  }

  void PutString(std::string_view text) {
    bool ascii = true;
    for (char c : text) ascii = ascii && static_cast<uint8_t>(c) < 0x80;
    if (ascii) {
      PutHeader(kAsciiString, text.size());
      out_.insert(out_.end(), text.begin(), text.end());
      return;
    }
    std::vector<uint16_t> units;
    units.reserve(text.size());
    for (size_t pos = 0; pos < text.size();) {
      std::optional<char32_t> cp = utf8::Decode(text, pos);
      if (!cp) {
        // Text is UTF-8 by contract; a stray byte becomes the replacement character.
        cp = 0xFFFD;
        ++pos;
      }
      if (*cp >= 0x10000) {
        units.push_back(static_cast<uint16_t>(0xD800 + ((*cp - 0x10000) >> 10)));
        units.push_back(static_cast<uint16_t>(0xDC00 + ((*cp - 0x10000) & 0x3FF)));
      } else {
        units.push_back(static_cast<uint16_t>(*cp));
      }
    }
    PutHeader(kUtf16String, units.size());
    for (uint16_t unit : units) Put(unit, 2);
  }

  void Emit(const Object& object) {
    if (!object.value) return PutString(object.key);
    const Value& value = *object.value;
    switch (value.kind()) {
      case Kind::String:
        return PutString(*value.string());
      case Kind::Boolean:
        out_.push_back(*value.boolean() ? kTrue : kFalse);
        return;
      case Kind::Integer: {
        const Integer integer = *value.integer();
        if (integer.isUnsigned) {
          out_.push_back(kInt | 4);
          Put(0, 8);
          Put(integer.asUnsigned(), 8);
        } else if (integer.value < 0) {
          out_.push_back(kInt | 3);
          Put(static_cast<uint64_t>(integer.value), 8);
        } else {
          const size_t width = WidthFor(static_cast<uint64_t>(integer.value));
          out_.push_back(static_cast<uint8_t>(kInt | std::countr_zero(width)));
          Put(static_cast<uint64_t>(integer.value), width);
        }
        return;
      }
      case Kind::Real:
        out_.push_back(kReal | 3);
        Put(std::bit_cast<uint64_t>(*value.real()), 8);
        return;
      case Kind::Date:
        out_.push_back(kDate);
        Put(std::bit_cast<uint64_t>(value.date()->secondsSinceReferenceDate), 8);
        return;
      case Kind::Data: {
        const Bytes& data = *value.data();
        PutHeader(kData, data.size());
        out_.insert(out_.end(), data.begin(), data.end());
        return;
      }
      case Kind::Array:
      case Kind::Dictionary: {
        const bool isDict = value.kind() == Kind::Dictionary;
        PutHeader(isDict ? kDict : kArray, isDict ? object.refCount / 2 : object.refCount);
        for (size_t i = 0; i < object.refCount; ++i) Put(refs_[object.firstRef + i], refSize_);
        return;
      }
    }
  }

  std::vector<Object> objects_;
  std::vector<size_t> refs_;
  std::unordered_map<std::string_view, size_t> strings_;
  size_t refSize_ = 1;
  Bytes out_;
};

}  // namespace

std::optional<Value> ReadBinary(std::span<const uint8_t> bytes, std::string* error) {
  return BinaryReader(bytes).Read(error);
}

Bytes WriteBinary(const Value& value) { return BinaryWriter().Write(value); }

}  // namespace brisvale::plist
