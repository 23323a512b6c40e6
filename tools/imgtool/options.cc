#include "imgtool/options.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>

namespace brisvale::imgtool {
namespace {

bool Contains(const std::vector<std::string>& list, const std::string& name) {
  return std::find(list.begin(), list.end(), name) != list.end();
}

}  // namespace

Options::Options(const std::vector<std::string>& args, const std::vector<std::string>& known,
                 const std::vector<std::string>& repeatable,
                 const std::vector<std::string>& flags) {
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if (arg.rfind("--", 0) != 0 && arg != "-o") throw ToolError("unexpected argument: " + arg, true);
    std::string name = arg == "-o" ? "--output" : arg;
    if (!Contains(known, name) && !Contains(repeatable, name) && !Contains(flags, name)) {
      throw ToolError("unknown option: " + arg, true);
    }
    if (values_.count(name) && !Contains(repeatable, name)) {
      throw ToolError("option given twice: " + arg, true);
    }
    if (Contains(flags, name)) {
      values_[name].push_back("");
      continue;
    }
    if (i + 1 >= args.size()) throw ToolError("option needs a value: " + arg, true);
    values_[name].push_back(args[++i]);
  }
}

std::optional<std::string> Options::Get(const std::string& name) const {
  auto found = values_.find(name);
  if (found == values_.end()) return std::nullopt;
  return found->second.front();
}

std::string Options::Require(const std::string& name) const {
  std::optional<std::string> value = Get(name);
  if (!value) throw ToolError("missing option " + name, true);
  return *value;
}

std::vector<std::string> Options::All(const std::string& name) const {
  auto found = values_.find(name);
  return found == values_.end() ? std::vector<std::string>{} : found->second;
}

Bytes ParseHex(const std::string& text, const std::string& what) {
  if (text.size() % 2 != 0) throw ToolError(what + ": odd number of hex digits");
  Bytes bytes;
  for (size_t i = 0; i < text.size(); i += 2) {
    auto digit = [&](char c) -> int {
      if (c >= '0' && c <= '9') return c - '0';
      if (c >= 'a' && c <= 'f') return c - 'a' + 10;
      if (c >= 'A' && c <= 'F') return c - 'A' + 10;
      throw ToolError(what + ": not a hex digit: " + std::string(1, c));
    };
    bytes.push_back(static_cast<uint8_t>(digit(text[i]) * 16 + digit(text[i + 1])));
  }
  return bytes;
}

uint64_t ParseNumber(const std::string& text, const std::string& what) {
  if (text.empty() || text[0] == '-') throw ToolError(what + ": not a number: " + text);
  errno = 0;
  char* end = nullptr;
  unsigned long long value = std::strtoull(text.c_str(), &end, 0);
  if (errno != 0 || *end != '\0') throw ToolError(what + ": not a number: " + text);
  return value;
}

bool ParseBool(const std::string& text, const std::string& what) {
  if (text == "true" || text == "1" || text == "yes") return true;
  if (text == "false" || text == "0" || text == "no") return false;
  throw ToolError(what + ": expected true or false, got " + text);
}

Bytes ReadFile(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) throw ToolError("cannot open " + path + ": " + std::strerror(errno));
  Bytes bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  if (file.bad()) throw ToolError("cannot read " + path);
  return bytes;
}

void WriteFile(const std::string& path, const Bytes& bytes) {
  std::ofstream file(path, std::ios::binary | std::ios::trunc);
  if (!file) throw ToolError("cannot create " + path + ": " + std::strerror(errno));
  file.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  if (!file.flush()) throw ToolError("cannot write " + path);
}

}  // namespace brisvale::imgtool
