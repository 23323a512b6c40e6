#include "json.h"

#include <cmath>
#include <cstdio>
#include <ctime>

namespace brisvale::tools {
namespace {

void AppendQuoted(std::string& out, std::string_view text) {
  out += '"';
  for (unsigned char c : text) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (c < 0x20) {
          char escaped[8];
          std::snprintf(escaped, sizeof escaped, "\\u%04x", c);
          out += escaped;
        } else {
          out += static_cast<char>(c);
        }
    }
  }
  out += '"';
}

void Newline(std::string& out, int indent) {
  out += '\n';
  out.append(static_cast<size_t>(indent) * 2, ' ');
}

void Append(std::string& out, const plist::Value& value, int indent) {
  switch (value.kind()) {
    case plist::Kind::String: AppendQuoted(out, *value.string()); break;
    case plist::Kind::Boolean: out += *value.boolean() ? "true" : "false"; break;
    case plist::Kind::Integer: {
      plist::Integer integer = *value.integer();
      out += integer.isUnsigned ? std::to_string(integer.asUnsigned()) : std::to_string(integer.value);
      break;
    }
    case plist::Kind::Real: {
      double real = *value.real();
      if (!std::isfinite(real)) {
        out += "null";
      } else {
        char text[32];
        std::snprintf(text, sizeof text, "%.17g", real);
        out += text;
      }
      break;
    }
    case plist::Kind::Data: {
      static const char kDigits[] = "0123456789abcdef";
      out += '"';
      for (uint8_t byte : *value.data()) {
        out += kDigits[byte >> 4];
        out += kDigits[byte & 0xf];
      }
      out += '"';
      break;
    }
    case plist::Kind::Date: AppendQuoted(out, value.description()); break;
    case plist::Kind::Array: {
      const plist::Array& array = *value.array();
      if (array.empty()) {
        out += "[]";
        break;
      }
      out += '[';
      for (size_t i = 0; i < array.size(); ++i) {
        if (i) out += ',';
        Newline(out, indent + 1);
        Append(out, array[i], indent + 1);
      }
      Newline(out, indent);
      out += ']';
      break;
    }
    case plist::Kind::Dictionary: {
      const plist::Dictionary& dictionary = *value.dictionary();
      if (dictionary.empty()) {
        out += "{}";
        break;
      }
      out += '{';
      bool first = true;
      for (const auto& [key, element] : dictionary) {
        if (!first) out += ',';
        first = false;
        Newline(out, indent + 1);
        AppendQuoted(out, key);
        out += ": ";
        Append(out, element, indent + 1);
      }
      Newline(out, indent);
      out += '}';
      break;
    }
  }
}

}  // namespace

std::string ToJson(const plist::Value& value, int indent) {
  std::string out;
  Append(out, value, indent);
  return out;
}

}  // namespace brisvale::tools
