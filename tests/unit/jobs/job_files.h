// Job files for the job tests: a scratch tree that writes property lists, and a job.
#pragma once

#include <filesystem>
#include <string>

#include "base/plist.h"
#include "test_files.h"

namespace brisvale::testing {

struct JobTree : ScratchDir {
  // Writes `value` at `relative`, parents created, as a binary or XML property list.
  void Write(const std::string& relative, const plist::Value& value, bool xml = false) const {
    std::filesystem::create_directories((*this / relative).parent_path());
    const std::string text = xml ? plist::WriteXml(value) : std::string();
    WriteFileBytes(*this / relative, xml ? plist::Bytes(text.begin(), text.end()) : plist::WriteBinary(value));
  }
};

inline plist::Dictionary Job(const std::string& label, plist::Value programArguments) {
  return {{"Label", plist::Value(label)}, {"ProgramArguments", std::move(programArguments)}};
}

}  // namespace brisvale::testing
