// Command-line parsing shared by the imgtool commands: "--name value" pairs, hex and
// number values, and the usage error that ends a command.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace brisvale::imgtool {

using Bytes = std::vector<uint8_t>;

// A command-line or input problem; main prints it and exits with status 2 (usage) or 1.
struct ToolError : std::runtime_error {
  ToolError(const std::string& message, bool usage = false)
      : std::runtime_error(message), isUsage(usage) {}
  bool isUsage;
};

// Options of one command. Options in `repeatable` may be given more than once; every
// other option at most once. Options in `flags` take no value.
class Options {
 public:
  Options(const std::vector<std::string>& args, const std::vector<std::string>& known,
          const std::vector<std::string>& repeatable = {},
          const std::vector<std::string>& flags = {});

  std::optional<std::string> Get(const std::string& name) const;
  std::string Require(const std::string& name) const;
  std::vector<std::string> All(const std::string& name) const;
  bool Has(const std::string& name) const { return values_.count(name) != 0; }

 private:
  std::map<std::string, std::vector<std::string>> values_;
};

Bytes ParseHex(const std::string& text, const std::string& what);
uint64_t ParseNumber(const std::string& text, const std::string& what);
bool ParseBool(const std::string& text, const std::string& what);

Bytes ReadFile(const std::string& path);
void WriteFile(const std::string& path, const Bytes& bytes);

}  // namespace brisvale::imgtool
