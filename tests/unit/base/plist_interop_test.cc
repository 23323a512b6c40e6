// Both formats against an independent reader and writer: python3's plistlib, when the
// machine has it.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <limits>

#include "base/plist.h"
#include "plist_test_util.h"

namespace brisvale::plist {
namespace {

namespace fs = std::filesystem;

// The same document as Expected() below, built on the Python side.
constexpr const char kScript[] = R"PY(
import datetime, plistlib, sys
d = sys.argv[1]
expected = {
    "Status": "Success",
    "Text": "h\u00e9llo \U0001F600 <&>",
    "Empty": "",
    "Ints": [0, 255, 256, 65535, 65536, 2**32 - 1, 2**32, 2**63 - 1, -1, -2**63, 2**63, 2**64 - 1],
    "Real": 0.1,
    "Flags": [True, False],
    "Data": bytes(range(40)),
    "When": datetime.datetime(2014, 4, 10, 22, 55, 30),
    "Nested": {"A": [], "D": {}, "L": [{"k": "v"}] * 20},
}
for name, fmt in (("ours.bplist", plistlib.FMT_BINARY), ("ours.xml", plistlib.FMT_XML)):
    with open(f"{d}/{name}", "rb") as f:
        got = plistlib.load(f, fmt=fmt)
    if got != expected:
        print(name, "differs:", got, file=sys.stderr)
        sys.exit(1)
with open(f"{d}/theirs.bplist", "wb") as f:
    plistlib.dump(expected, f, fmt=plistlib.FMT_BINARY)
with open(f"{d}/theirs.xml", "wb") as f:
    plistlib.dump(expected, f, fmt=plistlib.FMT_XML)
)PY";

Value Expected() {
  Array ints;
  for (int64_t n : {int64_t{0}, int64_t{255}, int64_t{256}, int64_t{65535}, int64_t{65536},
                    int64_t{4294967295}, int64_t{4294967296},
                    std::numeric_limits<int64_t>::max(), int64_t{-1},
                    std::numeric_limits<int64_t>::min()}) {
    ints.push_back(Value::Int(n));
  }
  ints.push_back(Value::UInt(uint64_t{1} << 63));
  ints.push_back(Value::UInt(std::numeric_limits<uint64_t>::max()));
  Bytes data(40);
  for (size_t i = 0; i < data.size(); ++i) data[i] = static_cast<uint8_t>(i);
  Array list(20, Value(Dictionary{{"k", Value("v")}}));
  return Value(Dictionary{
      {"Status", Value("Success")},
      {"Text", Value("h\xC3\xA9llo \xF0\x9F\x98\x80 <&>")},
      {"Empty", Value("")},
      {"Ints", Value(std::move(ints))},
      {"Real", Value::Real(0.1)},
      {"Flags", Value(Array{Value::Bool(true), Value::Bool(false)})},
      {"Data", Value(std::move(data))},
      {"When", Value(Date{418863330})},
      {"Nested", Value(Dictionary{{"A", Value(Array{})},
                                  {"D", Value(Dictionary{})},
                                  {"L", Value(std::move(list))}})},
  });
}

void WriteFile(const fs::path& path, std::span<const uint8_t> bytes) {
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
}

Bytes ReadFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

TEST(PlistInterop, Python3PlistlibAgreesBothWays) {
  if (std::system("python3 -c 'import plistlib' >/dev/null 2>&1") != 0) {
    GTEST_SKIP() << "python3 with plistlib is not available";
  }
  const fs::path dir = fs::temp_directory_path() / ("plist-interop-" + std::to_string(getpid()));
  fs::create_directories(dir);
  const Value expected = Expected();
  WriteFile(dir / "ours.bplist", WriteBinary(expected));
  const std::string xml = WriteXml(expected);
  WriteFile(dir / "ours.xml", AsBytes(xml));
  {
    std::ofstream(dir / "check.py") << kScript;
  }
  const std::string command = "python3 " + (dir / "check.py").string() + " " + dir.string();
  EXPECT_EQ(std::system(command.c_str()), 0) << "plistlib could not read what we wrote";

  for (const char* name : {"theirs.bplist", "theirs.xml"}) {
    std::string error;
    EXPECT_EQ(Read(ReadFile(dir / name), &error), expected) << name << ": " << error;
  }
  fs::remove_all(dir);
}

}  // namespace
}  // namespace brisvale::plist
