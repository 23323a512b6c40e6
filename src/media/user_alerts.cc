#include "media/user_alerts.h"

#include <utility>

#include "base/log.h"
#include "base/runloop.h"
#include "platform/services.h"

namespace brisvale {

void UserAlerts::Show(const char* titleKey, const char* bodyKey, const char* buttonKey,
                      registry::ObjectRef mediaObject) {
  alert::UserAlertService* service = CurrentServices().alerts;
  if (!service) return;
  std::call_once(dialogPreferenceLoaded_, [this] { LoadDialogPreference(); });
  if (!dialogsEnabled_) {
    Log(Level::Debug, "Dialogs are disabled.");
    return;
  }

  alert::Description description;
  description.topMost = true;
  std::unique_ptr<alert::Bundle> bundle = service->OpenBundle(kAlertBundlePath);
  if (!bundle) {
    Log(Level::Default, "Failed to create bundle.");
    return;
  }
  // A key without a text in the table shows as itself.
  auto localized = [&](const char* key) -> std::optional<std::string> {
    if (!key) return std::nullopt;
    return bundle->CopyLocalizedString(key, key, kAlertStringTable);
  };
  description.title = localized(titleKey);
  description.message = localized(bodyKey);
  description.defaultButtonTitle = localized(buttonKey);

  // The caller is inside an attach handler; the alert goes up after it has returned.
  service->MainLoop().Post([this, description = std::move(description),
                            mediaObject = std::move(mediaObject)] {
    DisplayAlert(description, mediaObject);
  });
}

void UserAlerts::LoadDialogPreference() {
  std::optional<plist::Value> value = CurrentServices().alerts->CopyPreference(
      kDialogPreferenceKey, kDialogPreferenceDomain, kDialogPreferenceUser);
  std::optional<bool> disabled = value ? value->boolean() : std::nullopt;
  if (!disabled) return;  // absent or not a boolean: the default stands
  dialogsEnabled_ = !*disabled;
  if (*disabled) {
    Log(Level::Debug, "Dialogs are disabled because DISABLE_DIALOGS preference was set in %s.",
        kDialogPreferenceDomain);
  }
}

void UserAlerts::DisplayAlert(const alert::Description& description,
                              const registry::ObjectRef& mediaObject) {
  alert::UserAlertService* service = CurrentServices().alerts;
  if (currentAlert_) {
    Log(Level::Debug, "Dialog already up, one is enough.");
    return;
  }
  currentAlert_ = service->CreateAlert(description, alert::AlertLevel::Plain, std::nullopt);
  if (!currentAlert_) {
    Log(Level::Default, "Failed to create user notification.");
    return;
  }
  if (!currentAlert_->CreateResponseSource(
          [this](alert::Alert& alert, uint32_t flags) { HandleAlertResponse(alert, flags); })) {
    currentAlert_.reset();
    Log(Level::Default, "Failed to create runloop source for user notification.");
    return;
  }
  if (mediaObject) WatchAlertMedia(mediaObject, service->MainLoop());
  currentAlert_->AttachResponseSource(service->MainLoop());
}

void UserAlerts::HandleAlertResponse(alert::Alert&, uint32_t) {
  // The answer carries no choice: whatever it was, the alert is over.
  currentAlert_.reset();
  StopWatchingAlertMedia();
}

void UserAlerts::WatchAlertMedia(const registry::ObjectRef& mediaObject, RunLoop& runLoop) {
  registry::DeviceRegistry* registry = CurrentServices().registry;
  if (!registry) return;
  auto port = registry->CreateNotificationPort();
  if (!port.ok() || !port.value) {
    Log(Level::Default, "KxServiceAddInterestNotification failed: 0x%04x", port.status & 0x3FFF);
    return;
  }
  alertInterestPort_ = std::move(port.value);
  alertInterestPort_->Attach(runLoop);
  auto interest = registry->AddInterestNotification(
      *alertInterestPort_, mediaObject,
      [this](const registry::ObjectRef& object, uint32_t message) {
        HandleAlertMediaInterest(object, message);
      });
  if (!interest.ok()) {
    StopWatchingAlertMedia();
    Log(Level::Default, "KxServiceAddInterestNotification failed: 0x%04x",
        interest.status & 0x3FFF);
    return;
  }
  alertInterestObject_ = std::move(interest.value);
}

void UserAlerts::HandleAlertMediaInterest(const registry::ObjectRef&, uint32_t messageType) {
  if (messageType != registry::kMessageServiceIsTerminated) return;
  if (currentAlert_) {
    if (long status = currentAlert_->Cancel(); status != 0) {
      Log(Level::Default, "Failed to cancel user notification: %ld", status);
    }
    currentAlert_.reset();
  }
  StopWatchingAlertMedia();
}

void UserAlerts::StopWatchingAlertMedia() {
  alertInterestPort_.reset();
  alertInterestObject_.reset();
}

UserAlerts& ProcessUserAlerts() {
  // Never destroyed: an alert still up at exit must not reach back into a main loop
  // that is already gone.
  static UserAlerts* alerts = new UserAlerts;
  return *alerts;
}

void ShowUserAlert(const char* titleKey, const char* bodyKey, const char* buttonKey,
                   registry::ObjectRef mediaObject) {
  ProcessUserAlerts().Show(titleKey, bodyKey, buttonKey, std::move(mediaObject));
}

}  // namespace brisvale
