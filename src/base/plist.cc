#include "base/plist.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <limits>

#include "base/plist_internal.h"

namespace brisvale::plist {

// ---- Dictionary ----

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  entries_.reserve(entries.size());
  for (const Entry& entry : entries) set(entry.first, entry.second);
}

std::optional<Dictionary> Dictionary::FromEntries(std::vector<Entry> entries) {
  // Small dictionaries (the common case) are checked pairwise; large ones by sorting
  // views of the keys, so a hostile document cannot make this quadratic.
  if (entries.size() <= 16) {
    for (size_t i = 0; i < entries.size(); ++i) {
      for (size_t j = i + 1; j < entries.size(); ++j) {
        if (entries[i].first == entries[j].first) return std::nullopt;
      }
    }
  } else {
    std::vector<std::string_view> keys;
    keys.reserve(entries.size());
    for (const Entry& entry : entries) keys.push_back(entry.first);
    std::sort(keys.begin(), keys.end());
    if (std::adjacent_find(keys.begin(), keys.end()) != keys.end()) return std::nullopt;
  }
  Dictionary dictionary;
  dictionary.entries_ = std::move(entries);
  return dictionary;
}

const Value* Dictionary::find(std::string_view key) const {
  for (const Entry& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

void Dictionary::set(std::string key, Value value) {
  for (Entry& entry : entries_) {
    if (entry.first == key) {
      entry.second = std::move(value);
      return;
    }
  }
  entries_.emplace_back(std::move(key), std::move(value));
}

bool Dictionary::erase(std::string_view key) {
  for (auto it = entries_.begin(); it != entries_.end(); ++it) {
    if (it->first == key) {
      entries_.erase(it);
      return true;
    }
  }
  return false;
}

bool Dictionary::operator==(const Dictionary& other) const {
  if (entries_.size() != other.entries_.size()) return false;
  for (size_t i = 0; i < entries_.size(); ++i) {
    const Entry& entry = entries_[i];
    // Same order is the usual case and costs one comparison per key.
    const Entry& same = other.entries_[i];
    const Value* found = same.first == entry.first ? &same.second : other.find(entry.first);
    if (found == nullptr || !(*found == entry.second)) return false;
  }
  return true;
}

// ---- Value ----

Value::Value() : storage_(std::make_shared<const Dictionary>()) {}
Value::Value(const char* text) : storage_(std::make_shared<const std::string>(text)) {}
Value::Value(std::string text) : storage_(std::make_shared<const std::string>(std::move(text))) {}
Value::Value(std::string_view text) : storage_(std::make_shared<const std::string>(text)) {}
Value::Value(Bytes bytes) : storage_(std::make_shared<const Bytes>(std::move(bytes))) {}
Value::Value(Integer integer) {
  // Keep one representation per number so that equality is by value.
  if (integer.isUnsigned && integer.value >= 0) integer.isUnsigned = false;
  storage_ = integer;
}
Value::Value(Date date) : storage_(date) {}
Value::Value(Array array) : storage_(std::make_shared<const Array>(std::move(array))) {}
Value::Value(Dictionary dictionary)
    : storage_(std::make_shared<const Dictionary>(std::move(dictionary))) {}

Value Value::UInt(uint64_t value) {
  return Value(Integer{static_cast<int64_t>(value),
                       value > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())});
}
Value Value::Real(double value) { return Value(Storage(RealNumber{value})); }
Value Value::Bool(bool value) { return Value(Storage(Boolean{value})); }

Kind Value::kind() const {
  static constexpr Kind kKinds[] = {Kind::Dictionary, Kind::Array, Kind::String, Kind::Data,
                                    Kind::Integer,    Kind::Real,  Kind::Boolean, Kind::Date};
  return kKinds[storage_.index()];
}

const std::string* Value::string() const {
  auto* p = std::get_if<std::shared_ptr<const std::string>>(&storage_);
  return p ? p->get() : nullptr;
}
const Bytes* Value::data() const {
  auto* p = std::get_if<std::shared_ptr<const Bytes>>(&storage_);
  return p ? p->get() : nullptr;
}
const Array* Value::array() const {
  auto* p = std::get_if<std::shared_ptr<const Array>>(&storage_);
  return p ? p->get() : nullptr;
}
const Dictionary* Value::dictionary() const {
  auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&storage_);
  return p ? p->get() : nullptr;
}
std::optional<Integer> Value::integer() const {
  auto* p = std::get_if<Integer>(&storage_);
  return p ? std::optional<Integer>(*p) : std::nullopt;
}
std::optional<double> Value::real() const {
  auto* p = std::get_if<RealNumber>(&storage_);
  return p ? std::optional<double>(p->value) : std::nullopt;
}
std::optional<bool> Value::boolean() const {
  auto* p = std::get_if<Boolean>(&storage_);
  return p ? std::optional<bool>(p->value) : std::nullopt;
}
std::optional<Date> Value::date() const {
  auto* p = std::get_if<Date>(&storage_);
  return p ? std::optional<Date>(*p) : std::nullopt;
}

const Value* Value::get(std::string_view key) const {
  const Dictionary* d = dictionary();
  return d ? d->find(key) : nullptr;
}

const std::string* Value::getString(std::string_view key) const {
  const Value* v = get(key);
  return v ? v->string() : nullptr;
}

bool Value::operator==(const Value& other) const {
  if (storage_.index() != other.storage_.index()) return false;
  // Shared containers compare by their contents, not by identity.
  return std::visit(
      [&](const auto& mine) -> bool {
        using T = std::decay_t<decltype(mine)>;
        const T& theirs = std::get<T>(other.storage_);
        if constexpr (requires { *mine; }) {
          return mine == theirs || *mine == *theirs;
        } else {
          return mine == theirs;
        }
      },
      storage_);
}

namespace {

// Description text with a budget: appends stop once `limit` bytes are exceeded.
class DescriptionText {
 public:
  explicit DescriptionText(size_t limit) : limit_(limit) { out_.reserve(std::min<size_t>(limit, 256) + 1); }
  bool full() const { return out_.size() > limit_; }
  void Append(std::string_view text) {
    if (!full()) out_.append(text.substr(0, limit_ + 1 - out_.size()));
  }
  void Append(char c) {
    if (!full()) out_ += c;
  }
  std::string Take() {
    if (!full()) return std::move(out_);
    size_t cut = limit_;
    // Back to the start of a character, so the text stays valid UTF-8.
    for (int back = 0; back < 3 && cut > 0 && (static_cast<uint8_t>(out_[cut]) & 0xC0) == 0x80; ++back) --cut;
    out_.resize(cut);
    out_ += kDescriptionCut;
    return std::move(out_);
  }

 private:
  size_t limit_;
  std::string out_;
};

void AppendDescription(const Value& value, DescriptionText& out);

void AppendHex(const Bytes& bytes, DescriptionText& out) {
  static constexpr char kDigits[] = "0123456789abcdef";
  out.Append('<');
  for (uint8_t b : bytes) {
    if (out.full()) return;
    const char digits[2] = {kDigits[b >> 4], kDigits[b & 0xF]};
    out.Append(std::string_view(digits, 2));
  }
  out.Append('>');
}

void AppendDescription(const Value& value, DescriptionText& out) {
  switch (value.kind()) {
    case Kind::String:
      out.Append(*value.string());
      return;
    case Kind::Data:
      AppendHex(*value.data(), out);
      return;
    case Kind::Integer: {
      Integer i = *value.integer();
      out.Append(i.isUnsigned ? std::to_string(i.asUnsigned()) : std::to_string(i.value));
      return;
    }
    case Kind::Real: {
      char buffer[64];
      std::snprintf(buffer, sizeof buffer, "%g", *value.real());
      out.Append(buffer);
      return;
    }
    case Kind::Boolean:
      out.Append(*value.boolean() ? "true" : "false");
      return;
    case Kind::Date:
      out.Append(internal::FormatIsoDate(*value.date()));
      return;
    case Kind::Array: {
      out.Append('[');
      std::string_view separator;
      for (const Value& element : *value.array()) {
        if (out.full()) return;
        out.Append(separator);
        AppendDescription(element, out);
        separator = ", ";
      }
      out.Append(']');
      return;
    }
    case Kind::Dictionary: {
      out.Append('{');
      std::string_view separator;
      for (const auto& [key, element] : *value.dictionary()) {
        if (out.full()) return;
        out.Append(separator);
        out.Append(key);
        out.Append(": ");
        AppendDescription(element, out);
        separator = ", ";
      }
      out.Append('}');
      return;
    }
  }
}

}  // namespace

std::string Value::description() const { return description(std::string::npos - 1); }

std::string Value::description(size_t limit) const {
  DescriptionText out(limit);
  AppendDescription(*this, out);
  return out.Take();
}

std::string Describe(const Value* value) { return value ? value->description() : "(null)"; }

std::optional<Value> Read(std::span<const uint8_t> bytes, std::string* error, Format* format) {
  static constexpr std::string_view kMagic = "bplist";
  bool binary = bytes.size() >= kMagic.size() &&
                std::string_view(reinterpret_cast<const char*>(bytes.data()), kMagic.size()) == kMagic;
  if (format) *format = binary ? Format::Binary : Format::Xml;
  return binary ? ReadBinary(bytes, error) : ReadXml(bytes, error);
}

// ---- shared text helpers ----

namespace internal {
namespace {

// Seconds from 1970-01-01 to 2001-01-01.
constexpr int64_t kReferenceUnixSeconds = 978307200;

// Proleptic Gregorian day arithmetic on days since 1970-01-01.
int64_t DaysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const unsigned yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

void CivilFromDays(int64_t z, int64_t& y, unsigned& m, unsigned& d) {
  z += 719468;
  const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  const unsigned doe = static_cast<unsigned>(z - era * 146097);
  const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const unsigned mp = (5 * doy + 2) / 153;
  d = doy - (153 * mp + 2) / 5 + 1;
  m = mp < 10 ? mp + 3 : mp - 9;
  y = static_cast<int64_t>(yoe) + era * 400 + (m <= 2);
}

bool IsLeap(int64_t y) { return (y % 4 == 0 && y % 100 != 0) || y % 400 == 0; }

unsigned DaysInMonth(int64_t y, unsigned m) {
  static constexpr unsigned kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return m == 2 && IsLeap(y) ? 29 : kDays[m - 1];
}

}  // namespace

std::string FormatIsoDate(Date date) {
  const int64_t first = (DaysFromCivil(1, 1, 1) * 86400) - kReferenceUnixSeconds;
  const int64_t last = (DaysFromCivil(9999, 12, 31) * 86400 + 86399) - kReferenceUnixSeconds;
  double seconds = std::floor(date.secondsSinceReferenceDate);
  int64_t whole = 0;
  if (std::isnan(seconds)) {
    whole = 0;
  } else if (seconds <= static_cast<double>(first)) {
    whole = first;
  } else if (seconds >= static_cast<double>(last)) {
    whole = last;
  } else {
    whole = static_cast<int64_t>(seconds);
  }
  int64_t unixSeconds = whole + kReferenceUnixSeconds;
  int64_t days = unixSeconds >= 0 ? unixSeconds / 86400 : -((-unixSeconds + 86399) / 86400);
  int64_t secondOfDay = unixSeconds - days * 86400;
  int64_t year;
  unsigned month, day;
  CivilFromDays(days, year, month, day);
  char buffer[96];
  std::snprintf(buffer, sizeof buffer, "%04lld-%02u-%02uT%02d:%02d:%02dZ",
                static_cast<long long>(year), month, day, static_cast<int>(secondOfDay / 3600),
                static_cast<int>(secondOfDay / 60 % 60), static_cast<int>(secondOfDay % 60));
  return buffer;
}

std::optional<Date> ParseIsoDate(std::string_view text) {
  // YYYY-MM-DDTHH:MM:SSZ
  if (text.size() != 20 || text[4] != '-' || text[7] != '-' || text[10] != 'T' ||
      text[13] != ':' || text[16] != ':' || text[19] != 'Z') {
    return std::nullopt;
  }
  auto number = [&](size_t at, size_t width) -> std::optional<unsigned> {
    unsigned n = 0;
    for (size_t i = at; i < at + width; ++i) {
      if (text[i] < '0' || text[i] > '9') return std::nullopt;
      n = n * 10 + static_cast<unsigned>(text[i] - '0');
    }
    return n;
  };
  auto year = number(0, 4), month = number(5, 2), day = number(8, 2);
  auto hour = number(11, 2), minute = number(14, 2), second = number(17, 2);
  if (!year || !month || !day || !hour || !minute || !second) return std::nullopt;
  if (*year < 1 || *month < 1 || *month > 12 || *day < 1 || *day > DaysInMonth(*year, *month) ||
      *hour > 23 || *minute > 59 || *second > 59) {
    return std::nullopt;
  }
  int64_t unixSeconds = DaysFromCivil(*year, *month, *day) * 86400 + *hour * 3600 + *minute * 60 + *second;
  return Date{static_cast<double>(unixSeconds - kReferenceUnixSeconds)};
}

}  // namespace internal
}  // namespace brisvale::plist
