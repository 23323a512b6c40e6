// Logging: printf conversions with the %@ and %{errno}d extensions, the capture sink, the stderr prefixes.
#include "base/log.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <chrono>

#include "base/utf8.h"

namespace brisvale::log {
namespace {

using plist::Value;

struct FormatCase {
  const char* name;
  std::string format;
  std::vector<Arg> args;
  std::string expected;
};

TEST(LogFormat, Conversions) {
  const Value text("disk2s1");
  const Value number = Value::Int(42);
  const std::optional<Value> missing;
  const char* nullText = nullptr;
  const std::string owned = "mnt";  // Args only borrow text, so it must outlive the table
  const std::vector<FormatCase> cases = {
      {"signed", "%d|%i|%ld|%lld", {-5, 7, -8L, 9LL}, "-5|7|-8|9"},
      {"upper hex and octal", "%X %o %#x", {255, 8, 255}, "FF 10 0xff"},
      {"int narrows like printf", "%x", {-1}, "ffffffff"},
      {"char length", "%hhd %hu", {300, 70000}, "44 4464"},
      {"size_t", "%zu", {SIZE_MAX}, "18446744073709551615"},
      {"width and alignment", "[%5d][%-5d][%05d]", {42, 42, 42}, "[   42][42   ][00042]"},
      {"star width", "[%*d][%-*s]", {4, 7, 3, "a"}, "[   7][a  ]"},
      {"strings", "%s/%s", {"var", owned}, "var/mnt"},
      {"string width and precision", "[%6s][%.2s]", {"abc", std::string_view("abcdef")}, "[   abc][ab]"},
      {"null strings and values", "%s %s %@", {nullText, nullptr, missing}, "(null) (null) (null)"},
      {"char", "%c%c", {'o', 'k'}, "ok"},
      {"floating", "%.3f %g %e", {1.5, 0.25, 1000.0}, "1.500 0.25 1.000000e+03"},
      {"percent", "100%% done", {}, "100% done"},
      {"objects", "mount %@ %@", {text, number}, "mount disk2s1 42"},
      {"errno", "Failed to open %s : %{errno}d", {"/dev/x", ENOENT}, "Failed to open /dev/x : 2"},
      {"null pointer", "%p", {static_cast<const void*>(nullptr)}, "(nil)"},
      {"missing argument", "%d and %d", {1}, "1 and <?>"},
      {"mismatches do not shift", "%s %d %f %s %d", {5, "5", 1, "b", 3}, "<?> <?> <?> b 3"},
      {"bad star width", "[%*d]", {"w", 5}, "[<?>]"},
      {"huge width refused", "%99999999d", {1}, "<?>"},
      {"unknown conversion shown", "%y %n", {1}, "%y %n"},
      {"cut off at end", "50%", {}, "50%"},
      {"cut off annotation", "%{errno", {1}, "%{errno"},
  };
  for (const FormatCase& c : cases) {
    EXPECT_EQ(Format(c.format, c.args), c.expected) << c.name;
  }
}

// Hostile values: whatever their size or sharing, a line stays within its bound, ends
// in the cut mark, keeps whole characters and costs no more than the bound to build.
TEST(LogFormat, LongValuesAreCutEarly) {
  // A million references to one 64 KiB value.
  const Value nested(plist::Array(1000, Value(plist::Array(1000, Value(plist::Bytes(64 * 1024, 0xAB))))));
  const std::string longText(100000, 'x');
  std::string utf8;
  for (int i = 0; i < 5000; ++i) utf8 += "\xC3\xA9";
  struct Case {
    const char* name;
    std::string format;
    std::vector<Arg> args;
    size_t maxLength;
  };
  const std::vector<Case> cases = {
      {"nested sharing", "Invalid value for %@: %@", {"MountPath", nested}, kMaxValueLength + 40},
      {"many long values", "%@ %@ %@ %@ %@ %@", {longText, longText, longText, longText, longText, longText},
       kMaxLineLength + 8},
      {"cut inside a character", "%@", {utf8}, kMaxValueLength + 8},
  };
  for (const Case& c : cases) {
    const auto start = std::chrono::steady_clock::now();
    const std::string line = Format(c.format, c.args);
    const auto took = std::chrono::steady_clock::now() - start;
    EXPECT_LE(line.size(), c.maxLength) << c.name;
    EXPECT_TRUE(line.ends_with(plist::kDescriptionCut)) << c.name;
    EXPECT_TRUE(utf8::IsValid(line)) << c.name;
    EXPECT_LT(took, std::chrono::milliseconds(200)) << c.name;  // 2 s when walked in full
  }
}

TEST(LogCapture, RecordsLevelsGatesDebugAndRestoresWhatWasBefore) {
  SetDebugEnabled(false);
  CaptureSink outer;
  SetDebugEnabled(false);
  std::optional<CaptureSink> inner(std::in_place);
  EXPECT_TRUE(DebugEnabled());
  Log(Level::Default, "Invalid request type: %@", Value("Bogus"));
  Log(Level::Info, "info %d", 1);
  Log(Level::Error, "fatal");
  Log(Level::Debug, "debug on");
  SetDebugEnabled(false);
  Log(Level::Debug, "debug off");
  SetDebugEnabled(true);

  const std::vector<Line> expected = {{Level::Default, "Invalid request type: Bogus"},
                                      {Level::Info, "info 1"},
                                      {Level::Error, "fatal"},
                                      {Level::Debug, "debug on"}};
  EXPECT_EQ(inner->Lines(), expected);
  EXPECT_TRUE(inner->Contains(Level::Error, "fatal"));
  EXPECT_FALSE(inner->Contains(Level::Default, "fatal"));
  inner->Clear();
  EXPECT_TRUE(inner->Texts().empty());

  inner.reset();
  EXPECT_FALSE(DebugEnabled());
  Log(Level::Default, "to outer");
  EXPECT_EQ(outer.Texts(), std::vector<std::string>{"to outer"});
}

// The stderr sink: plain level names on a terminal, syslog priorities for the journal.
TEST(LogStderr, PrefixesForJournalAndTerminal) {
  const char* previous = getenv("JOURNAL_STREAM");
  const std::string savedJournal = previous ? previous : "";
  const struct {
    const char* journal;
    std::string expected;
  } cases[] = {{nullptr, "default: a\ndebug: b\ninfo: c\nerror: d\n"}, {"8:1234", "<5>a\n<7>b\n<6>c\n<3>d\n"}};
  for (const auto& c : cases) {
    c.journal ? setenv("JOURNAL_STREAM", c.journal, 1) : unsetenv("JOURNAL_STREAM");
    StderrSink sink;
    ::testing::internal::CaptureStderr();
    for (const auto& [level, text] : {std::pair{Level::Default, "a"}, {Level::Debug, "b"}, {Level::Info, "c"},
                                      {Level::Error, "d"}}) {
      sink.Write(level, text);
    }
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), c.expected);
  }
  previous ? setenv("JOURNAL_STREAM", savedJournal.c_str(), 1) : unsetenv("JOURNAL_STREAM");
}

}  // namespace
}  // namespace brisvale::log
