// User alerts about removable media: a one-button alert built from three localization
// keys, shown later from the main queue, one at a time, taken down by itself when the
// medium it is about leaves the registry, and switched off for the whole device by the
// "DISABLE_DIALOGS" preference (read once per process).
//
// All state but the preference is touched on the main thread only: the display task,
// the alert's answer and the medium's removal all arrive through the main loop.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>

#include "platform/device_registry.h"
#include "platform/user_alert.h"

namespace brisvale {

class RunLoop;

inline constexpr const char* kAlertBundlePath =
    "/System/Library/PrivateFrameworks/Brisvale.framework";
inline constexpr const char* kAlertStringTable = "Localization";
inline constexpr const char* kDialogPreferenceDomain = "com.vantrel.mobile.device_o_matic";
inline constexpr const char* kDialogPreferenceKey = "DISABLE_DIALOGS";
inline constexpr const char* kDialogPreferenceUser = "mobile";

// The alert state of one process. The daemon uses the one ProcessUserAlerts() returns;
// tests make their own.
class UserAlerts {
 public:
  UserAlerts() = default;
  UserAlerts(const UserAlerts&) = delete;
  UserAlerts& operator=(const UserAlerts&) = delete;

  // Any key may be nullptr (that field is left out); without `mediaObject` the alert is
  // not tied to a medium. The alert appears once the main loop runs the queued display.
  void Show(const char* titleKey, const char* bodyKey, const char* buttonKey,
            registry::ObjectRef mediaObject);

  bool AlertIsUp() const { return currentAlert_ != nullptr; }
  bool WatchesMedia() const { return alertInterestPort_ || alertInterestObject_; }

 private:
  void LoadDialogPreference();
  void DisplayAlert(const alert::Description& description, const registry::ObjectRef& mediaObject);
  void HandleAlertResponse(alert::Alert& alert, uint32_t responseFlags);
  void WatchAlertMedia(const registry::ObjectRef& mediaObject, RunLoop& runLoop);
  void HandleAlertMediaInterest(const registry::ObjectRef& object, uint32_t messageType);
  void StopWatchingAlertMedia();

  std::once_flag dialogPreferenceLoaded_;
  std::atomic<bool> dialogsEnabled_ = true;
  std::unique_ptr<alert::Alert> currentAlert_;
  std::unique_ptr<registry::NotificationPort> alertInterestPort_;
  std::unique_ptr<registry::Notification> alertInterestObject_;
};

UserAlerts& ProcessUserAlerts();

// Tells the person at the device, once, why a medium could not be used.
void ShowUserAlert(const char* titleKey, const char* bodyKey, const char* buttonKey,
                   registry::ObjectRef mediaObject);

}  // namespace brisvale
