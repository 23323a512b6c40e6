// The system log: exact message lines at four levels, printf-style formatting with
// the platform's extensions, and swappable sinks (stderr for the daemon, a capture
// sink for tests that assert the exact line a failure logs).
//
// Format: printf conversions (%s %d %u %x %04x %ld %llu %zu %p %c %f %% ...) plus
//   %@          a property-list value's description; "(null)" when missing. Takes a
//               plist::Value, const plist::Value*, std::optional<plist::Value>, or text.
//   %{errno}d   an error number, printed as the number.
// Arguments are type-checked at run time against their conversion: a mismatch or a
// missing argument prints "<?>" instead of reading garbage.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/plist.h"

namespace brisvale::log {

// Syslog priorities: default -> notice, debug -> debug, info -> info, error -> err.
enum class Level { Default, Debug, Info, Error };

const char* LevelName(Level level);  // "default", "debug", "info", "error"

struct Line {
  Level level;
  std::string text;
  bool operator==(const Line&) const = default;
};

class Sink {
 public:
  virtual ~Sink() = default;
  virtual void Write(Level level, std::string_view text) = 0;
};

// stderr: "<N>message" when JOURNAL_STREAM is set (journald), "level: message" otherwise.
class StderrSink : public Sink {
 public:
  void Write(Level level, std::string_view text) override;
};

// Installs the sink for the whole process; returns the previous one. nullptr restores
// the stderr sink.
Sink* SetSink(Sink* sink);
// Debug lines are dropped unless enabled (the daemon's --verbose, BRISVALE_DEBUG=1).
void SetDebugEnabled(bool enabled);
bool DebugEnabled();

// Records every line (debug included) while it is alive; restores the previous sink
// and debug setting when it goes. Lines may arrive from any thread.
class CaptureSink : public Sink {
 public:
  CaptureSink();
  ~CaptureSink() override;
  CaptureSink(const CaptureSink&) = delete;
  CaptureSink& operator=(const CaptureSink&) = delete;

  void Write(Level level, std::string_view text) override;
  std::vector<Line> Lines() const;
  std::vector<std::string> Texts() const;  // the texts alone, in order
  std::vector<std::string> Texts(Level level) const;  // those logged at `level`
  bool Contains(Level level, std::string_view text) const;
  void Clear();

 private:
  Sink* previous_;
  bool previousDebug_;
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

// One formatting argument, converted from whatever the caller passed.
struct Arg {
  std::variant<int64_t, uint64_t, double, const char*, const plist::Value*, std::string_view,
               const void*>
      value;

  Arg(int v) : value(static_cast<int64_t>(v)) {}
  Arg(long v) : value(static_cast<int64_t>(v)) {}
  Arg(long long v) : value(static_cast<int64_t>(v)) {}
  Arg(unsigned v) : value(static_cast<uint64_t>(v)) {}
  Arg(unsigned long v) : value(static_cast<uint64_t>(v)) {}
  Arg(unsigned long long v) : value(static_cast<uint64_t>(v)) {}
  Arg(double v) : value(v) {}
  Arg(const char* v) : value(v) {}
  Arg(const std::string& v) : value(std::string_view(v)) {}
  Arg(std::string_view v) : value(v) {}
  Arg(const plist::Value& v) : value(&v) {}
  Arg(const plist::Value* v) : value(v) {}
  Arg(const std::optional<plist::Value>& v) : value(v ? &*v : nullptr) {}
  Arg(const void* v) : value(v) {}
  Arg(std::nullptr_t) : value(static_cast<const plist::Value*>(nullptr)) {}
};

// A %@ or %s argument prints at most kMaxValueLength bytes and a line at most
// kMaxLineLength; what goes beyond is cut and marked with plist::kDescriptionCut.
inline constexpr size_t kMaxValueLength = 4096;
inline constexpr size_t kMaxLineLength = 16384;

std::string Format(std::string_view format, const std::vector<Arg>& args);
void Write(Level level, std::string_view text);

template <typename... Args>
void Log(Level level, std::string_view format, const Args&... args) {
  if (level == Level::Debug && !DebugEnabled()) return;
  Write(level, Format(format, std::vector<Arg>{Arg(args)...}));
}

}  // namespace brisvale::log

namespace brisvale {
using log::Level;
using log::Log;
}  // namespace brisvale
