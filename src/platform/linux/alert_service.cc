// The Linux user-alert service: agent alerts, preference files and string tables.
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <map>

#include "base/runloop.h"
#include "base/unique_fd.h"
#include "platform/linux/alert_linux.h"

namespace brisvale::alert {

std::unique_ptr<Alert> CreateAgentAlert(const std::string& socketPath,
                                        const Description& description, AlertLevel level,
                                        std::optional<std::chrono::seconds> timeout);

namespace {

// Preference files and string tables are small; anything bigger is not one.
constexpr off_t kMaxPropertyListFile = 1 << 20;

// A name that stays one path component.
bool IsPlainName(std::string_view name) {
  return !name.empty() && name.front() != '.' && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

// Reads a property list from a regular file, never following a link at its last
// component and never waiting on a FIFO or device that someone put in its place.
std::optional<plist::Value> ReadPropertyListFile(int directoryFd, const std::string& path) {
  UniqueFd fd(openat(directoryFd, path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode) ||
      status.st_size > kMaxPropertyListFile) {
    return std::nullopt;
  }
  plist::Bytes bytes(static_cast<size_t>(status.st_size));
  size_t filled = 0;
  while (filled < bytes.size()) {
    ssize_t got = read(fd.get(), bytes.data() + filled, bytes.size() - filled);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    filled += static_cast<size_t>(got);
  }
  bytes.resize(filled);
  return plist::Read(bytes);
}

class DirectoryBundle final : public Bundle {
 public:
  explicit DirectoryBundle(UniqueFd directory) : directory_(std::move(directory)) {}

  std::string CopyLocalizedString(std::string_view key, std::string_view fallback,
                                  std::string_view table) override {
    const plist::Value* tableValue = Table(table);
    const std::string* text = tableValue ? tableValue->getString(key) : nullptr;
    return text ? *text : std::string(fallback);
  }

 private:
  // Each table is read once per bundle; a missing or unreadable one is remembered too.
  const plist::Value* Table(std::string_view name) {
    auto found = tables_.find(name);
    if (found == tables_.end()) {
      std::optional<plist::Value> table;
      if (IsPlainName(name)) {
        table = ReadPropertyListFile(directory_.get(),
                                     "en.lproj/" + std::string(name) + ".strings");
      }
      if (table && !table->dictionary()) table.reset();
      found = tables_.emplace(std::string(name), std::move(table)).first;
    }
    return found->second ? &*found->second : nullptr;
  }

  UniqueFd directory_;
  std::map<std::string, std::optional<plist::Value>, std::less<>> tables_;
};

class LinuxUserAlertService final : public UserAlertService {
 public:
  LinuxUserAlertService(RunLoop& loop, LinuxAlertOptions options)
      : loop_(loop), options_(std::move(options)) {}

  std::unique_ptr<Alert> CreateAlert(const Description& description, AlertLevel level,
                                     std::optional<std::chrono::seconds> timeout) override {
    return CreateAgentAlert(options_.agentSocketPath, description, level, timeout);
  }

  std::optional<plist::Value> CopyPreference(std::string_view key, std::string_view domain,
                                             std::string_view user) override {
    std::optional<std::string> path = PreferenceFilePath(domain, user);
    if (!path) return std::nullopt;
    std::optional<plist::Value> preferences =
        ReadPropertyListFile(AT_FDCWD, options_.root + *path);
    const plist::Value* value = preferences ? preferences->get(key) : nullptr;
    if (!value) return std::nullopt;
    return *value;
  }

  std::unique_ptr<Bundle> OpenBundle(std::string_view path) override {
    UniqueFd directory(
        open((options_.root + std::string(path)).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory) return nullptr;
    return std::make_unique<DirectoryBundle>(std::move(directory));
  }

  RunLoop& MainLoop() override { return loop_; }

 private:
  RunLoop& loop_;
  LinuxAlertOptions options_;
};

}  // namespace

std::optional<std::string> PreferenceFilePath(std::string_view domain, std::string_view user) {
  if (!IsPlainName(domain) || !IsPlainName(user)) return std::nullopt;
  return "/var/" + std::string(user) + "/Library/Preferences/" + std::string(domain) + ".plist";
}

std::unique_ptr<UserAlertService> CreateLinuxUserAlertService(RunLoop& loop,
                                                              LinuxAlertOptions options) {
  return std::make_unique<LinuxUserAlertService>(loop, std::move(options));
}

}  // namespace brisvale::alert
