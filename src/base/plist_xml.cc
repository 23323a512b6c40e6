// XML property lists: read with expat, written by hand.
#include <expat.h>

#include <charconv>
#include <climits>
#include <cstring>
#include <limits>
#include <memory>

#include "base/plist.h"
#include "base/plist_internal.h"
#include "base/utf8.h"

namespace brisvale::plist {
namespace {

enum class Element { Plist, Array, Dict, Key, String, Data, Date, Integer, Real, True, False };

std::optional<Element> ElementNamed(std::string_view name) {
  static constexpr std::pair<std::string_view, Element> kNames[] = {
      {"plist", Element::Plist},     {"array", Element::Array}, {"dict", Element::Dict},
      {"key", Element::Key},         {"string", Element::String}, {"data", Element::Data},
      {"date", Element::Date},       {"integer", Element::Integer}, {"real", Element::Real},
      {"true", Element::True},       {"false", Element::False},
  };
  for (const auto& [text, element] : kNames) {
    if (text == name) return element;
  }
  return std::nullopt;
}

bool IsXmlSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::string_view Trimmed(std::string_view text) {
  while (!text.empty() && IsXmlSpace(text.front())) text.remove_prefix(1);
  while (!text.empty() && IsXmlSpace(text.back())) text.remove_suffix(1);
  return text;
}

std::optional<Integer> ParseInteger(std::string_view text) {
  text = Trimmed(text);
  bool negative = false;
  if (!text.empty() && (text.front() == '-' || text.front() == '+')) {
    negative = text.front() == '-';
    text.remove_prefix(1);
  }
  uint64_t magnitude = 0;
  auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), magnitude);
  if (text.empty() || status != std::errc() || end != text.data() + text.size()) {
    return std::nullopt;
  }
  if (!negative) {
    return Integer{static_cast<int64_t>(magnitude),
                   magnitude > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())};
  }
  if (magnitude > uint64_t{1} << 63) return std::nullopt;
  return Integer{static_cast<int64_t>(0 - magnitude), false};
}

std::optional<double> ParseReal(std::string_view text) {
  text = Trimmed(text);
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  double value = 0;
  auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), value);
  // Magnitudes beyond a double (1e999) are refused: no writer produces them, and
  // reading them as 0 would be silently wrong.
  if (text.empty() || end != text.data() + text.size() || status != std::errc()) {
    return std::nullopt;
  }
  return value;
}

int Base64Digit(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

// Standard base64 with padding; whitespace anywhere is ignored.
std::optional<Bytes> DecodeBase64(std::string_view text) {
  std::string digits;
  digits.reserve(text.size());
  for (char c : text) {
    if (!IsXmlSpace(c)) digits += c;
  }
  if (digits.size() % 4 != 0) return std::nullopt;
  Bytes out;
  out.reserve(digits.size() / 4 * 3);
  for (size_t i = 0; i < digits.size(); i += 4) {
    const bool lastGroup = i + 4 == digits.size();
    const size_t padding = lastGroup ? (digits[i + 3] == '=') + (digits[i + 2] == '=') : 0;
    if (padding == 1 && digits[i + 2] == '=') return std::nullopt;  // "xx=y"
    uint32_t group = 0;
    for (size_t j = 0; j < 4; ++j) {
      const int digit = j < 4 - padding ? Base64Digit(digits[i + j]) : 0;
      if (digit < 0) return std::nullopt;
      group = (group << 6) | static_cast<uint32_t>(digit);
    }
    out.push_back(static_cast<uint8_t>(group >> 16));
    if (padding < 2) out.push_back(static_cast<uint8_t>(group >> 8));
    if (padding < 1) out.push_back(static_cast<uint8_t>(group));
  }
  return out;
}

class XmlReader {
 public:
  XmlReader() : parser_(XML_ParserCreate(nullptr)) {}

  std::optional<Value> Read(std::span<const uint8_t> bytes, std::string* error) {
    if (!parser_) return Failed(error, "out of memory");
    XML_SetUserData(parser_.get(), this);
    XML_SetElementHandler(parser_.get(), &XmlReader::OnStart, &XmlReader::OnEnd);
    XML_SetCharacterDataHandler(parser_.get(), &XmlReader::OnText);
    XML_SetStartDoctypeDeclHandler(parser_.get(), &XmlReader::OnDoctype);
    XML_SetEntityDeclHandler(parser_.get(), &XmlReader::OnEntityDecl);
    XML_SetSkippedEntityHandler(parser_.get(), &XmlReader::OnSkippedEntity);
    XML_SetParamEntityParsing(parser_.get(), XML_PARAM_ENTITY_PARSING_NEVER);

    // expat takes an int length; feed large documents in pieces.
    constexpr size_t kChunk = size_t{1} << 20;
    size_t at = 0;
    do {
      const size_t length = std::min(kChunk, bytes.size() - at);
      const bool last = at + length == bytes.size();
      if (XML_Parse(parser_.get(), reinterpret_cast<const char*>(bytes.data() + at),
                    static_cast<int>(length), last) != XML_STATUS_OK) {
        if (!error_) error_ = XML_ErrorString(XML_GetErrorCode(parser_.get()));
        return Failed(error, error_);
      }
      at += length;
    } while (at < bytes.size());
    if (!result_) return Failed(error, "no property list element");
    return std::move(result_);
  }

 private:
  struct Frame {
    Element element;
    Array elements;                         // Array, and the one value of Plist
    std::vector<Dictionary::Entry> entries;  // Dict
    std::optional<std::string> key;          // Dict: the key waiting for its value
  };

  struct ParserDeleter {
    void operator()(XML_Parser parser) const { XML_ParserFree(parser); }
  };

  static std::optional<Value> Failed(std::string* error, const char* why) {
    if (error) *error = why;
    return std::nullopt;
  }

  void Stop(const char* why) {
    if (!error_) error_ = why;
    XML_StopParser(parser_.get(), XML_FALSE);
  }
  bool Stopped() const { return error_ != nullptr; }

  static XmlReader& Self(void* data) { return *static_cast<XmlReader*>(data); }

  static void OnDoctype(void* data, const XML_Char*, const XML_Char*, const XML_Char*,
                        int hasInternalSubset) {
    if (hasInternalSubset) Self(data).Stop("document type declarations are not accepted");
  }
  static void OnEntityDecl(void* data, const XML_Char*, int, const XML_Char*, int,
                           const XML_Char*, const XML_Char*, const XML_Char*, const XML_Char*) {
    Self(data).Stop("entity declarations are not accepted");
  }
  static void OnSkippedEntity(void* data, const XML_Char*, int) {
    Self(data).Stop("undefined entity");
  }
  static void OnStart(void* data, const XML_Char* name, const XML_Char**) {
    Self(data).Start(name);
  }
  static void OnEnd(void* data, const XML_Char*) { Self(data).End(); }
  static void OnText(void* data, const XML_Char* text, int length) {
    Self(data).Text(std::string_view(text, static_cast<size_t>(length)));
  }

  void Start(std::string_view name) {
    if (Stopped()) return;
    if (leaf_) return Stop("element inside a text element");
    std::optional<Element> element = ElementNamed(name);
    if (!element) return Stop("unknown element");
    if (stack_.empty()) {
      if (*element != Element::Plist || sawRoot_) return Stop("document element is not plist");
      sawRoot_ = true;
      stack_.push_back(Frame{Element::Plist, {}, {}, {}});
      return;
    }
    const Frame& parent = stack_.back();
    const bool wantsKey = parent.element == Element::Dict && !parent.key;
    if (*element == Element::Plist) return Stop("nested plist element");
    if ((*element == Element::Key) != wantsKey) {
      return Stop(wantsKey ? "dictionary value without a key" : "key outside a dictionary");
    }
    if (parent.element == Element::Plist && !parent.elements.empty()) {
      return Stop("more than one top-level value");
    }
    if (*element != Element::Key && ++objects_ > kMaxObjects) return Stop("too many objects");
    if (*element == Element::Array || *element == Element::Dict) {
      if (stack_.size() > kMaxDepth) return Stop("containers nested too deeply");
      stack_.push_back(Frame{*element, {}, {}, {}});
      return;
    }
    leaf_ = element;
    text_.clear();
  }

  void Text(std::string_view text) {
    if (Stopped()) return;
    const bool takesText = leaf_ && *leaf_ != Element::True && *leaf_ != Element::False;
    if (takesText) {
      text_ += text;
      return;
    }
    for (char c : text) {
      if (!IsXmlSpace(c)) return Stop("text outside a text element");
    }
  }

  void End() {
    if (Stopped()) return;
    if (leaf_) {
      const Element element = *leaf_;
      leaf_.reset();
      if (element == Element::Key) {
        stack_.back().key = std::move(text_);
        return;
      }
      std::optional<Value> value = LeafValue(element);
      if (!value) return Stop(MalformedText(element));
      return Deliver(std::move(*value));
    }
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    switch (frame.element) {
      case Element::Plist:
        if (frame.elements.empty()) return Stop("empty plist element");
        result_ = std::move(frame.elements.front());
        return;
      case Element::Array:
        return Deliver(Value(std::move(frame.elements)));
      default: {
        if (frame.key) return Stop("dictionary key without a value");
        std::optional<Dictionary> dictionary = Dictionary::FromEntries(std::move(frame.entries));
        if (!dictionary) return Stop("duplicate dictionary key");
        return Deliver(Value(std::move(*dictionary)));
      }
    }
  }

  static const char* MalformedText(Element element) {
    switch (element) {
      case Element::Integer: return "malformed integer";
      case Element::Real: return "malformed real";
      case Element::Date: return "malformed date";
      case Element::Data: return "malformed base64 data";
      default: return "malformed value";
    }
  }

  std::optional<Value> LeafValue(Element element) {
    switch (element) {
      case Element::String:
        return Value(std::move(text_));
      case Element::True:
      case Element::False:
        return Value::Bool(element == Element::True);
      case Element::Integer:
        if (auto integer = ParseInteger(text_)) return Value(*integer);
        return std::nullopt;
      case Element::Real:
        if (auto real = ParseReal(text_)) return Value::Real(*real);
        return std::nullopt;
      case Element::Date:
        if (auto date = internal::ParseIsoDate(Trimmed(text_))) return Value(*date);
        return std::nullopt;
      case Element::Data:
        if (auto bytes = DecodeBase64(text_)) return Value(std::move(*bytes));
        return std::nullopt;
      default:
        return std::nullopt;
    }
  }

  void Deliver(Value value) {
    Frame& parent = stack_.back();
    if (parent.element == Element::Dict) {
      parent.entries.emplace_back(std::move(*parent.key), std::move(value));
      parent.key.reset();
    } else {
      parent.elements.push_back(std::move(value));
    }
  }

  std::unique_ptr<XML_ParserStruct, ParserDeleter> parser_;
  const char* error_ = nullptr;
  std::vector<Frame> stack_;
  std::optional<Element> leaf_;
  std::string text_;
  std::optional<Value> result_;
  size_t objects_ = 0;
  bool sawRoot_ = false;
};

// ---- writer ----

void AppendEscaped(std::string& out, std::string_view text) {
  for (size_t pos = 0; pos < text.size();) {
    const char c = text[pos];
    switch (c) {
      case '&': out += "&amp;"; ++pos; continue;
      case '<': out += "&lt;"; ++pos; continue;
      case '>': out += "&gt;"; ++pos; continue;
      // A literal CR would come back as LF after the parser's line-end handling.
      case '\r': out += "&#13;"; ++pos; continue;
      case '\t': case '\n': out += c; ++pos; continue;
      default: break;
    }
    const size_t start = pos;
    std::optional<char32_t> cp = utf8::Decode(text, pos);
    // XML 1.0 cannot carry control characters, U+FFFE/U+FFFF or broken UTF-8 at all;
    // they become the replacement character rather than making the document unreadable.
    // (Two keys that differ only in such characters then collide, and the reader
    // refuses the duplicate.)
    if (!cp) {
      ++pos;
      utf8::Append(out, 0xFFFD);
    } else if (*cp < 0x20 || *cp == 0xFFFE || *cp == 0xFFFF) {
      utf8::Append(out, 0xFFFD);
    } else {
      out.append(text.substr(start, pos - start));
    }
  }
}

void AppendBase64(std::string& out, const Bytes& bytes) {
  static constexpr char kDigits[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  size_t i = 0;
  for (; i + 3 <= bytes.size(); i += 3) {
    const uint32_t group = (bytes[i] << 16) | (bytes[i + 1] << 8) | bytes[i + 2];
    out += kDigits[group >> 18];
    out += kDigits[(group >> 12) & 63];
    out += kDigits[(group >> 6) & 63];
    out += kDigits[group & 63];
  }
  if (const size_t rest = bytes.size() - i; rest > 0) {
    const uint32_t group = (bytes[i] << 16) | (rest == 2 ? bytes[i + 1] << 8 : 0);
    out += kDigits[group >> 18];
    out += kDigits[(group >> 12) & 63];
    out += rest == 2 ? kDigits[(group >> 6) & 63] : '=';
    out += '=';
  }
}

void AppendValue(std::string& out, const Value& value, size_t indent) {
  out.append(indent, '\t');
  switch (value.kind()) {
    case Kind::String:
      out += "<string>";
      AppendEscaped(out, *value.string());
      out += "</string>\n";
      return;
    case Kind::Integer: {
      const Integer integer = *value.integer();
      out += "<integer>";
      out += integer.isUnsigned ? std::to_string(integer.asUnsigned())
                                : std::to_string(integer.value);
      out += "</integer>\n";
      return;
    }
    case Kind::Real: {
      char buffer[64];
      auto [end, status] = std::to_chars(buffer, buffer + sizeof buffer, *value.real());
      out += "<real>";
      out.append(buffer, status == std::errc() ? end : buffer);
      out += "</real>\n";
      return;
    }
    case Kind::Boolean:
      out += *value.boolean() ? "<true/>\n" : "<false/>\n";
      return;
    case Kind::Date:
      out += "<date>";
      out += internal::FormatIsoDate(*value.date());
      out += "</date>\n";
      return;
    case Kind::Data:
      out += "<data>";
      AppendBase64(out, *value.data());
      out += "</data>\n";
      return;
    case Kind::Array: {
      const Array& array = *value.array();
      if (array.empty()) {
        out += "<array/>\n";
        return;
      }
      out += "<array>\n";
      for (const Value& element : array) AppendValue(out, element, indent + 1);
      out.append(indent, '\t');
      out += "</array>\n";
      return;
    }
    case Kind::Dictionary: {
      const Dictionary& dictionary = *value.dictionary();
      if (dictionary.empty()) {
        out += "<dict/>\n";
        return;
      }
      out += "<dict>\n";
      for (const auto& [key, element] : dictionary) {
        out.append(indent + 1, '\t');
        out += "<key>";
        AppendEscaped(out, key);
        out += "</key>\n";
        AppendValue(out, element, indent + 1);
      }
      out.append(indent, '\t');
      out += "</dict>\n";
      return;
    }
  }
}

}  // namespace

std::optional<Value> ReadXml(std::span<const uint8_t> bytes, std::string* error) {
  return XmlReader().Read(bytes, error);
}

std::string WriteXml(const Value& value) {
  std::string out =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist>\n"
      "<plist version=\"1.0\">\n";
  AppendValue(out, value, 0);
  out += "</plist>\n";
  return out;
}

}  // namespace brisvale::plist
