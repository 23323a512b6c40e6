// A temporary directory tree for the job tests, removed with everything in it.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "base/plist.h"

namespace brisvale::testing {

struct TempTree {
  std::filesystem::path root;
  TempTree() {
    char pattern[] = "/tmp/brisvale-jobs-XXXXXX";
    root = ::mkdtemp(pattern);
  }
  ~TempTree() { std::filesystem::remove_all(root); }

  // Writes `value` at `relative`, parents created, as a binary or XML property list.
  void Write(const std::string& relative, const plist::Value& value, bool xml = false) const {
    std::filesystem::create_directories((root / relative).parent_path());
    const plist::Bytes bytes = xml ? plist::Bytes() : plist::WriteBinary(value);
    std::ofstream(root / relative, std::ios::binary)
        << (xml ? plist::WriteXml(value) : std::string(bytes.begin(), bytes.end()));
  }
};

inline plist::Dictionary Job(const std::string& label, plist::Value programArguments) {
  return {{"Label", plist::Value(label)}, {"ProgramArguments", std::move(programArguments)}};
}

}  // namespace brisvale::testing
