// Helpers shared by the job tests: a temporary directory tree and job files in it.
#pragma once

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "base/plist.h"

namespace brisvale::testing {

// A directory removed with everything in it when the test ends.
struct TempTree {
  std::filesystem::path root;
  TempTree() {
    char pattern[] = "/tmp/brisvale-jobs-XXXXXX";
    root = ::mkdtemp(pattern);
  }
  ~TempTree() { std::filesystem::remove_all(root); }

  // Writes `value` at `relative` (parents created), binary or XML.
  void Write(const std::string& relative, const plist::Value& value, bool xml = false) const {
    const std::filesystem::path path = root / relative;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream out(path, std::ios::binary);
    if (xml) {
      out << plist::WriteXml(value);
    } else {
      const plist::Bytes bytes = plist::WriteBinary(value);
      out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    }
  }
};

inline plist::Dictionary Job(const std::string& label, plist::Value programArguments) {
  return {{"Label", plist::Value(label)}, {"ProgramArguments", std::move(programArguments)}};
}

}  // namespace brisvale::testing
