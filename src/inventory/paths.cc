#include "inventory/paths.h"

#include <cctype>
#include <cstring>

#include "base/utf8.h"

namespace brisvale::paths {
namespace {

bool IsHexDigit(char c) { return std::isxdigit(static_cast<unsigned char>(c)) != 0; }

bool MayStandInUrl(unsigned char c) {
  return c > 0x20 && c < 0x7F && !std::strchr("<>\"{}|\\^`", c);
}

bool IsUnreservedInPath(unsigned char c) {
  return std::isalnum(c) || std::strchr("-._~/!$&'()*+,;=:@", c);
}

// The path part of a URL: after "scheme:" and "//authority", before '?' or '#'.
std::string_view UrlPath(std::string_view url) {
  if (size_t colon = url.find(':'); colon != std::string_view::npos && colon > 0 &&
                                    std::isalpha(static_cast<unsigned char>(url[0]))) {
    const std::string_view scheme = url.substr(0, colon);
    if (scheme.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789+.-") ==
        std::string_view::npos) {
      url.remove_prefix(colon + 1);
    }
  }
  if (url.starts_with("//")) {
    const size_t pathStart = url.find('/', 2);
    url = pathStart == std::string_view::npos ? std::string_view() : url.substr(pathStart);
  }
  return url.substr(0, url.find_first_of("?#"));
}

}  // namespace

std::optional<std::string> UrlFromText(std::string_view text) {
  if (text.empty()) return std::nullopt;
  for (size_t i = 0; i < text.size(); ++i) {
    if (!MayStandInUrl(static_cast<unsigned char>(text[i]))) return std::nullopt;
    if (text[i] == '%' && (i + 2 >= text.size() || !IsHexDigit(text[i + 1]) || !IsHexDigit(text[i + 2]))) {
      return std::nullopt;
    }
  }
  return std::string(text);
}

std::optional<std::string> FileUrlFromPath(std::string_view path) {
  if (path.empty()) return std::nullopt;
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string url = path.front() == '/' ? "file://" : "";
  for (unsigned char c : path) {
    if (IsUnreservedInPath(c)) {
      url += static_cast<char>(c);
    } else {
      url += '%';
      url += kHex[c >> 4];
      url += kHex[c & 0xF];
    }
  }
  return url;
}

std::optional<std::string_view> LastPathComponent(std::string_view url) {
  std::string_view path = UrlPath(url);
  if (path.empty()) return std::nullopt;
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  if (path == "/") return path;
  // Escapes are left as they stand: device names never carry them, and a component
  // that would need decoding cannot name a device either.
  return path.substr(path.rfind('/') + 1);
}

std::vector<std::string_view> PathComponents(std::string_view path) {
  std::vector<std::string_view> components;
  if (path.starts_with('/')) components.push_back(path.substr(0, 1));
  while (!path.empty()) {
    const size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    if (!component.empty()) components.push_back(component);
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return components;
}

std::string Latin1ToUtf8(const plist::Bytes& bytes) {
  std::string text;
  text.reserve(bytes.size());
  for (uint8_t byte : bytes) utf8::Append(text, byte);
  return text;
}

}  // namespace brisvale::paths
