// User alerts: a modal, top-most, one-button alert shown to the person at the device,
// whose answer arrives on the main loop like every other event; plus the two read-only
// services alerts are built from, the preference store and the localized-string lookup.
//
// Handles are owned: destroying an Alert releases it (its response source goes with it
// and nothing more is delivered), destroying a Bundle closes it.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale {
class RunLoop;
}

namespace brisvale::alert {

enum class AlertLevel : int { Plain = 0, Stop = 1, Note = 2, Caution = 3 };

// What the alert shows. A field left out is not shown.
struct Description {
  bool topMost = false;
  std::optional<std::string> title;
  std::optional<std::string> message;
  std::optional<std::string> defaultButtonTitle;
};

// The response flags an alert ends with.
inline constexpr uint32_t kResponseDefault = 0;  // its button was pressed
// It went away without an answer: the one showing it is gone or answered nonsense.
inline constexpr uint32_t kResponseCancel = 3;

class Alert;
// Called at most once per alert, on the loop the response source is attached to. The
// handler may destroy the alert.
using ResponseHandler = std::function<void(Alert& alert, uint32_t responseFlags)>;

class Alert {
 public:
  virtual ~Alert() = default;
  // Makes the source that calls `handler` when the alert is answered; nothing is
  // delivered before it is attached. False when no source can be made.
  virtual bool CreateResponseSource(ResponseHandler handler) = 0;
  virtual void AttachResponseSource(RunLoop& loop) = 0;
  // Takes the alert down without an answer: 0, or a negative errno when it could not be
  // told to go (it is gone all the same once the handle is released).
  virtual long Cancel() = 0;
};

// A directory of localized resources.
class Bundle {
 public:
  virtual ~Bundle() = default;
  // The text of `key` in the string table `table`; `fallback` when either is missing.
  virtual std::string CopyLocalizedString(std::string_view key, std::string_view fallback,
                                          std::string_view table) = 0;
};

class UserAlertService {
 public:
  virtual ~UserAlertService() = default;

  // Shows the alert at `level`, staying up `timeout` long (none: until answered or
  // cancelled). nullptr when it cannot be shown.
  virtual std::unique_ptr<Alert> CreateAlert(const Description& description, AlertLevel level,
                                             std::optional<std::chrono::seconds> timeout) = 0;

  // The value of `key` in the preferences of `domain` for `user` on this host; none when
  // the key, the domain or a readable preference file is missing.
  virtual std::optional<plist::Value> CopyPreference(std::string_view key,
                                                     std::string_view domain,
                                                     std::string_view user) = 0;

  // The bundle in the directory `path`; nullptr when there is no such directory.
  virtual std::unique_ptr<Bundle> OpenBundle(std::string_view path) = 0;

  // The loop that serves the main queue; answers are delivered there.
  virtual RunLoop& MainLoop() = 0;
};

}  // namespace brisvale::alert
