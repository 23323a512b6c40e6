#include "base/log.h"

#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace brisvale::log {
namespace {

constexpr std::string_view kBadArgument = "<?>";
// A width or precision beyond this is a caller's mistake, not a request for megabytes.
constexpr int kMaxFieldSize = 4096;

int SyslogPriority(Level level) {
  switch (level) {
    case Level::Default: return 5;  // notice
    case Level::Debug: return 7;
    case Level::Info: return 6;
    case Level::Error: return 3;  // err
  }
  return 5;
}

StderrSink& DefaultSink() {
  static StderrSink sink;
  return sink;
}

// Serializes delivery, so that a sink is never replaced (and destroyed) while a line
// from the background queue is being written to it.
std::mutex& SinkMutex() {
  static std::mutex mutex;
  return mutex;
}
Sink* g_sink = nullptr;  // guarded by SinkMutex(); nullptr means the stderr sink

// -1 until first asked: the environment decides unless the program already did.
std::atomic<int> g_debug{-1};

template <typename T>
void AppendPrintf(std::string& out, const std::string& format, T value) {
  char buffer[256];
  int n = std::snprintf(buffer, sizeof buffer, format.c_str(), value);
  if (n < 0) {
    out += kBadArgument;
    return;
  }
  if (static_cast<size_t>(n) < sizeof buffer) {
    out.append(buffer, static_cast<size_t>(n));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), format.c_str(), value);
  out.append(big.data(), static_cast<size_t>(n));
}

// One parsed conversion: "%{annotation}<flags><width>.<precision><length><conversion>".
struct Conversion {
  std::string annotation;
  std::string flags;
  int width = -1;
  int precision = -1;
  std::string length;
  char conversion = 0;
};

class ArgReader {
 public:
  explicit ArgReader(const std::vector<Arg>& args) : args_(args) {}
  const Arg* Next() { return next_ < args_.size() ? &args_[next_++] : nullptr; }

 private:
  const std::vector<Arg>& args_;
  size_t next_ = 0;
};

std::optional<int64_t> AsInteger(const Arg* arg) {
  if (!arg) return std::nullopt;
  if (auto* v = std::get_if<int64_t>(&arg->value)) return *v;
  if (auto* v = std::get_if<uint64_t>(&arg->value)) return static_cast<int64_t>(*v);
  return std::nullopt;
}

// Text cut to kMaxValueLength like a value's description is.
std::string Bounded(std::string_view text) {
  if (text.size() <= kMaxValueLength) return std::string(text);
  return plist::Value(std::string(text.substr(0, kMaxValueLength + 1))).description(kMaxValueLength);
}

// The text an argument stands for in %@ and %s, at most kMaxValueLength bytes and the
// cut mark; none when it is not text or a value.
std::optional<std::string> AsText(const Arg* arg, bool forObject) {
  if (!arg) return std::nullopt;
  if (auto* v = std::get_if<const char*>(&arg->value)) return *v ? Bounded(*v) : "(null)";
  if (auto* v = std::get_if<std::string_view>(&arg->value)) return Bounded(*v);
  if (auto* v = std::get_if<const plist::Value*>(&arg->value)) {
    if (!*v) return plist::Describe(nullptr);
    if (!forObject) {
      if (const std::string* s = (*v)->string()) return Bounded(*s);
    }
    // Stops early: a request can share one large value among a thousand references.
    return (*v)->description(kMaxValueLength);
  }
  return std::nullopt;
}

std::string KeepFlags(const std::string& flags, std::string_view allowed) {
  std::string kept;
  for (char c : flags) {
    if (allowed.find(c) != std::string_view::npos) kept += c;
  }
  return kept;
}

std::string PrintfSpec(const Conversion& c, std::string_view allowedFlags, bool withPrecision,
                       std::string_view lengthAndConversion) {
  std::string conversionText = "%" + KeepFlags(c.flags, allowedFlags);
  if (c.width >= 0) conversionText += std::to_string(c.width);
  if (withPrecision && c.precision >= 0) conversionText += "." + std::to_string(c.precision);
  conversionText += lengthAndConversion;
  return conversionText;
}

void AppendSigned(std::string& out, const Conversion& c, int64_t value) {
  // Narrow the way printf's length modifier would, so "%d" of a 32-bit code reads the same.
  long long narrowed;
  if (c.length == "hh") narrowed = static_cast<signed char>(value);
  else if (c.length == "h") narrowed = static_cast<short>(value);
  else if (c.length.empty()) narrowed = static_cast<int>(value);
  else narrowed = value;
  AppendPrintf(out, PrintfSpec(c, "-+ 0'", true, "lld"), narrowed);
}

void AppendUnsigned(std::string& out, const Conversion& c, int64_t value) {
  auto bits = static_cast<uint64_t>(value);
  unsigned long long narrowed;
  if (c.length == "hh") narrowed = static_cast<unsigned char>(bits);
  else if (c.length == "h") narrowed = static_cast<unsigned short>(bits);
  else if (c.length.empty()) narrowed = static_cast<unsigned int>(bits);
  else narrowed = bits;
  std::string allowed = c.conversion == 'u' ? "-0'" : "-0#";
  AppendPrintf(out, PrintfSpec(c, allowed, true, std::string("ll") + c.conversion), narrowed);
}

void AppendText(std::string& out, const Conversion& c, const std::string& text) {
  if (c.width < 0 && c.precision < 0) {
    out += text;
    return;
  }
  AppendPrintf(out, PrintfSpec(c, "-", true, "s"), text.c_str());
}

void AppendConversion(std::string& out, const Conversion& c, ArgReader& args) {
  switch (c.conversion) {
    case 'd':
    case 'i': {
      auto value = AsInteger(args.Next());
      if (!value) break;
      AppendSigned(out, c, *value);
      return;
    }
    case 'u':
    case 'x':
    case 'X':
    case 'o': {
      auto value = AsInteger(args.Next());
      if (!value) break;
      AppendUnsigned(out, c, *value);
      return;
    }
    case 'c': {
      auto value = AsInteger(args.Next());
      if (!value) break;
      AppendPrintf(out, PrintfSpec(c, "-", false, "c"), static_cast<int>(static_cast<unsigned char>(*value)));
      return;
    }
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
    case 'a':
    case 'A': {
      const Arg* arg = args.Next();
      const double* value = arg ? std::get_if<double>(&arg->value) : nullptr;
      if (!value) break;
      AppendPrintf(out, PrintfSpec(c, "-+ #0'", true, std::string(1, c.conversion)), *value);
      return;
    }
    case 's':
    case '@': {
      auto text = AsText(args.Next(), c.conversion == '@');
      if (!text) break;
      AppendText(out, c, *text);
      return;
    }
    case 'p': {
      const Arg* arg = args.Next();
      if (!arg) break;
      const void* pointer = nullptr;
      if (auto* v = std::get_if<const void*>(&arg->value)) pointer = *v;
      else if (auto* v = std::get_if<const char*>(&arg->value)) pointer = *v;
      else if (auto* v = std::get_if<const plist::Value*>(&arg->value)) pointer = *v;
      else break;
      AppendPrintf(out, PrintfSpec(c, "-", false, "p"), pointer);
      return;
    }
  }
  out += kBadArgument;
}

bool IsDigit(char c) { return c >= '0' && c <= '9'; }

// Reads digits or '*' (taking an integer argument). Returns false when '*' has no
// usable argument or the number is out of range.
bool ParseField(std::string_view format, size_t& i, ArgReader& args, int& field, bool& leftAlign) {
  if (i < format.size() && format[i] == '*') {
    ++i;
    auto value = AsInteger(args.Next());
    if (!value || *value > kMaxFieldSize || *value < -kMaxFieldSize) return false;
    if (*value < 0) {
      leftAlign = true;  // printf's rule for a negative '*' width
      field = static_cast<int>(-*value);
    } else {
      field = static_cast<int>(*value);
    }
    return true;
  }
  if (i >= format.size() || !IsDigit(format[i])) return true;
  long value = 0;
  bool inRange = true;
  while (i < format.size() && IsDigit(format[i])) {
    value = value * 10 + (format[i] - '0');
    if (value > kMaxFieldSize) {
      inRange = false;
      value = kMaxFieldSize;
    }
    ++i;
  }
  field = static_cast<int>(value);
  return inRange;
}

}  // namespace

const char* LevelName(Level level) {
  switch (level) {
    case Level::Default: return "default";
    case Level::Debug: return "debug";
    case Level::Info: return "info";
    case Level::Error: return "error";
  }
  return "default";
}

void StderrSink::Write(Level level, std::string_view text) {
  std::string line;
  line.reserve(text.size() + 16);
  if (std::getenv("JOURNAL_STREAM")) {
    line += "<" + std::to_string(SyslogPriority(level)) + ">";
  } else {
    line += LevelName(level);
    line += ": ";
  }
  line += text;
  line += '\n';
  // One write per line, so lines from two threads or processes never interleave.
  size_t done = 0;
  while (done < line.size()) {
    ssize_t n = ::write(STDERR_FILENO, line.data() + done, line.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    done += static_cast<size_t>(n);
  }
}

Sink* SetSink(Sink* sink) {
  std::lock_guard lock(SinkMutex());
  Sink* previous = g_sink ? g_sink : &DefaultSink();
  g_sink = sink == &DefaultSink() ? nullptr : sink;
  return previous;
}

void SetDebugEnabled(bool enabled) { g_debug.store(enabled ? 1 : 0); }

bool DebugEnabled() {
  int value = g_debug.load();
  if (value < 0) {
    const char* env = std::getenv("BRISVALE_DEBUG");
    int fromEnv = env && std::strcmp(env, "1") == 0 ? 1 : 0;
    g_debug.compare_exchange_strong(value, fromEnv);
    value = g_debug.load();
  }
  return value == 1;
}

CaptureSink::CaptureSink() : previous_(nullptr), previousDebug_(DebugEnabled()) {
  SetDebugEnabled(true);
  previous_ = SetSink(this);
}

CaptureSink::~CaptureSink() {
  SetSink(previous_);
  SetDebugEnabled(previousDebug_);
}

void CaptureSink::Write(Level level, std::string_view text) {
  std::lock_guard lock(mutex_);
  lines_.push_back(Line{level, std::string(text)});
}

std::vector<Line> CaptureSink::Lines() const {
  std::lock_guard lock(mutex_);
  return lines_;
}

std::vector<std::string> CaptureSink::Texts() const {
  std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  texts.reserve(lines_.size());
  for (const Line& line : lines_) texts.push_back(line.text);
  return texts;
}

std::vector<std::string> CaptureSink::Texts(Level level) const {
  std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const Line& line : lines_) {
    if (line.level == level) texts.push_back(line.text);
  }
  return texts;
}

bool CaptureSink::Contains(Level level, std::string_view text) const {
  std::lock_guard lock(mutex_);
  for (const Line& line : lines_) {
    if (line.level == level && line.text == text) return true;
  }
  return false;
}

void CaptureSink::Clear() {
  std::lock_guard lock(mutex_);
  lines_.clear();
}

std::string Format(std::string_view format, const std::vector<Arg>& args) {
  std::string out;
  out.reserve(format.size() + 32);
  ArgReader reader(args);
  size_t i = 0;
  while (i < format.size()) {
    size_t percent = format.find('%', i);
    if (percent == std::string_view::npos) {
      out.append(format.substr(i));
      break;
    }
    out.append(format.substr(i, percent - i));
    size_t start = percent;
    i = percent + 1;

    Conversion c;
    if (i < format.size() && format[i] == '{') {
      size_t close = format.find('}', i);
      if (close == std::string_view::npos) {
        out.append(format.substr(start));
        break;
      }
      c.annotation = std::string(format.substr(i + 1, close - i - 1));
      i = close + 1;
    }
    while (i < format.size() && std::string_view("-+ #0'").find(format[i]) != std::string_view::npos) {
      c.flags += format[i++];
    }
    bool leftAlign = false;
    bool fieldsOk = ParseField(format, i, reader, c.width, leftAlign);
    if (leftAlign) c.flags += '-';
    if (i < format.size() && format[i] == '.') {
      ++i;
      c.precision = 0;
      bool ignored = false;
      fieldsOk = ParseField(format, i, reader, c.precision, ignored) && fieldsOk;
    }
    for (std::string_view length : {"hh", "ll", "h", "l", "z", "j", "t", "L", "q"}) {
      if (format.substr(i).starts_with(length)) {
        c.length = length;
        i += length.size();
        break;
      }
    }
    if (i >= format.size()) {  // a conversion cut off by the end of the text
      out.append(format.substr(start));
      break;
    }
    c.conversion = format[i++];
    if (c.conversion == '%') {
      out += '%';
      continue;
    }
    if (std::string_view("diuxXocsp@fFeEgGaA").find(c.conversion) == std::string_view::npos) {
      // Unknown conversions (and %n, which would write) are shown as written.
      out.append(format.substr(start, i - start));
      continue;
    }
    if (!fieldsOk) {
      reader.Next();  // the conversion's own argument is still spent
      out += kBadArgument;
      continue;
    }
    AppendConversion(out, c, reader);
    if (out.size() > kMaxLineLength) break;
  }
  if (out.size() > kMaxLineLength) {
    // Several long values in one line: the line as a whole is cut the same way.
    return plist::Value(std::move(out)).description(kMaxLineLength);
  }
  return out;
}

void Write(Level level, std::string_view text) {
  if (level == Level::Debug && !DebugEnabled()) return;
  std::lock_guard lock(SinkMutex());
  Sink* sink = g_sink ? g_sink : &DefaultSink();
  sink->Write(level, text);
}

}  // namespace brisvale::log
