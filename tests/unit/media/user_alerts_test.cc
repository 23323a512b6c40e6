// The alert state machine over a fake alert service and the in-process registry: what is
// shown, what is dropped, what takes an alert down, and the exact lines on the way.
#include <gtest/gtest.h>

#include "base/log.h"
#include "base/runloop.h"
#include "media/user_alerts.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using alert::Description;

// Shows what it is given unless told to fail; counts what is alive and what was cancelled.
struct FakeAlertService final : alert::UserAlertService {
  struct Alert final : alert::Alert {
    explicit Alert(FakeAlertService& s) : service(s) { ++service.liveAlerts, service.current = this; }
    ~Alert() override { --service.liveAlerts, service.current = nullptr; }
    bool CreateResponseSource(alert::ResponseHandler h) override {
      handler = std::move(h);
      return !service.noSource;
    }
    void AttachResponseSource(RunLoop&) override { attached = true; }
    long Cancel() override { return ++service.cancels, service.cancelStatus; }
    FakeAlertService& service;
    alert::ResponseHandler handler;
    bool attached = false;
  };
  struct Bundle final : alert::Bundle {
    std::string CopyLocalizedString(std::string_view key, std::string_view fallback,
                                    std::string_view table) override {
      if (table == "Localization" && key == "MOUNT_FAILURE_BODY") return "Reformat it.";
      return std::string(fallback);
    }
  };

  std::unique_ptr<alert::Alert> CreateAlert(const Description& description,
                                            alert::AlertLevel level,
                                            std::optional<std::chrono::seconds> timeout) override {
    EXPECT_TRUE(level == alert::AlertLevel::Plain && !timeout);
    if (noAgent) return nullptr;
    shown.push_back(description);
    return std::make_unique<Alert>(*this);
  }
  std::optional<plist::Value> CopyPreference(std::string_view key, std::string_view domain,
                                             std::string_view user) override {
    ++preferenceReads;
    EXPECT_EQ(std::string(key) + " " + std::string(domain) + " " + std::string(user),
              "DISABLE_DIALOGS com.vantrel.mobile.device_o_matic mobile");
    return preference;
  }
  std::unique_ptr<alert::Bundle> OpenBundle(std::string_view path) override {
    EXPECT_EQ(path, "/System/Library/PrivateFrameworks/Brisvale.framework");
    return noBundle ? nullptr : std::make_unique<Bundle>();
  }
  RunLoop& MainLoop() override { return loop; }

  RunLoop loop;
  std::optional<plist::Value> preference;
  bool noBundle = false, noAgent = false, noSource = false;
  long cancelStatus = 0;
  int preferenceReads = 0;
  std::vector<Description> shown;
  Alert* current = nullptr;
  int liveAlerts = 0, cancels = 0;
};

// A medium the registry never published: adding an interest on it fails.
struct StrayMedium final : registry::Object {
  uint64_t EntryId() const override { return 99; }
  const std::string& ClassName() const override { return name; }
  bool ConformsTo(std::string_view c) const override { return c == name; }
  std::optional<plist::Value> Property(std::string_view) const override { return std::nullopt; }
  registry::Result<plist::Value> CopyProperties() const override { return {}; }
  registry::Result<registry::ObjectRef> Parent() const override { return {registry::kNoDevice, nullptr}; }
  std::vector<registry::ObjectRef> Children() const override { return {}; }
  bool IsTerminated() const override { return false; }
  std::string name = "KxMedia";
};

struct UserAlertsTest : ::testing::Test {
  // Shows the mount-failure alert and lets the main loop run what that queued.
  void ShowMountFailure(const registry::ObjectRef& medium = nullptr) {
    alerts.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", medium);
    Drain();
  }
  void Drain() {
    while (service.loop.RunOnce() > 0) {
    }
  }
  void Press() {
    ASSERT_TRUE(service.current && service.current->attached);
    auto handler = service.current->handler;
    handler(*service.current, alert::kResponseDefault);
  }
  registry::ObjectRef PublishMedium() { return registry.Publish(nullptr, "KxMedia", {}); }

  log::CaptureSink log;
  FakeAlertService service;
  registry::RegistryModel registry;
  ScopedServices services{Services{&registry, nullptr, nullptr, nullptr, &service}};
  UserAlerts alerts;
};

TEST_F(UserAlertsTest, OnlyABooleanPreferenceSwitchesAlertsOff) {
  struct Case {
    std::optional<plist::Value> preference;
    size_t shown;
    std::vector<std::string> lines;
  };
  const std::string disabled =
      "Dialogs are disabled because DISABLE_DIALOGS preference was set in "
      "com.vantrel.mobile.device_o_matic.";
  const Case cases[] = {
      {std::nullopt, 2, {}},
      {plist::Value::Bool(false), 2, {}},
      {plist::Value::Bool(true), 0, {disabled, "Dialogs are disabled.", "Dialogs are disabled."}},
      {plist::Value("YES"), 2, {}},
      {plist::Value::Int(1), 2, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.preference ? c.preference->description() : "(absent)");
    FakeAlertService fake;
    fake.preference = c.preference;
    ScopedServices scoped(Services{&registry, nullptr, nullptr, nullptr, &fake});
    UserAlerts fresh;
    log.Clear();
    for (int i = 0; i < 2; ++i) {
      fresh.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", nullptr);
      while (fake.loop.RunOnce() > 0) {
      }
      if (fake.current) fake.current->handler(*fake.current, alert::kResponseDefault);
    }
    EXPECT_EQ(fake.shown.size(), c.shown);
    EXPECT_EQ(fake.preferenceReads, 1);
    EXPECT_EQ(log.Texts(), c.lines);
  }
}

TEST_F(UserAlertsTest, FailuresShowNothingAndLeaveNoAlert) {
  struct Case {
    bool FakeAlertService::*flag;
    std::string line;
  };
  const Case cases[] = {
      {&FakeAlertService::noBundle, "Failed to create bundle."},
      {&FakeAlertService::noAgent, "Failed to create user notification."},
      {&FakeAlertService::noSource, "Failed to create runloop source for user notification."},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.line);
    service.*c.flag = true;
    log.Clear();
    ShowMountFailure(PublishMedium());
    EXPECT_EQ(log.Lines(), (std::vector<log::Line>{{Level::Default, c.line}}));
    EXPECT_FALSE(alerts.AlertIsUp() || alerts.WatchesMedia() || service.liveAlerts);
    service.*c.flag = false;
  }
}

TEST_F(UserAlertsTest, SecondAlertIsDroppedUntilTheFirstIsAnswered) {
  registry::ObjectRef medium = PublishMedium();
  alerts.Show("VERIFICATION_FAILURE_TITLE", "MOUNT_FAILURE_BODY", nullptr, medium);
  alerts.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", medium);
  EXPECT_TRUE(service.shown.empty()) << "shown before the main loop ran";
  Drain();
  ASSERT_EQ(service.shown.size(), 1u);
  const Description& shown = service.shown[0];  // a key without a text shows as itself
  EXPECT_TRUE(shown.topMost);
  EXPECT_EQ(shown.title, "VERIFICATION_FAILURE_TITLE");
  EXPECT_EQ(shown.message, "Reformat it.");
  EXPECT_EQ(shown.defaultButtonTitle, std::nullopt);
  EXPECT_EQ(log.Lines(), (std::vector<log::Line>{{Level::Debug, "Dialog already up, one is enough."}}));
  EXPECT_TRUE(alerts.WatchesMedia());

  Press();
  EXPECT_FALSE(alerts.AlertIsUp() || alerts.WatchesMedia() || service.liveAlerts);
  registry.Terminate(medium);  // the watch went with the answer: nothing to cancel
  Drain();
  EXPECT_EQ(service.cancels, 0);

  ShowMountFailure();
  EXPECT_EQ(service.shown.size(), 2u);
}

TEST_F(UserAlertsTest, PullingTheMediumOutTakesItsAlertDown) {
  struct Case {
    long cancelStatus;
    std::vector<std::string> lines;
  };
  const Case cases[] = {{0, {}}, {-32, {"Failed to cancel user notification: -32"}}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.cancelStatus);
    service.cancelStatus = c.cancelStatus;
    registry::ObjectRef medium = PublishMedium();
    ShowMountFailure(medium);
    ASSERT_TRUE(alerts.AlertIsUp() && alerts.WatchesMedia());
    log.Clear();
    registry.Terminate(medium);
    Drain();
    EXPECT_EQ(service.cancels, 1);
    EXPECT_EQ(log.Texts(), c.lines);
    EXPECT_FALSE(alerts.AlertIsUp() || alerts.WatchesMedia() || service.liveAlerts);
    service.cancels = 0;

    ShowMountFailure(PublishMedium());  // the next failure is shown at once
    EXPECT_TRUE(alerts.AlertIsUp());
    Press();
  }
}

TEST_F(UserAlertsTest, FailedRemovalWatchLeavesTheAlertUp) {
  ShowMountFailure(std::make_shared<StrayMedium>());
  EXPECT_EQ(log.Lines(),
            (std::vector<log::Line>{{Level::Default, "KxServiceAddInterestNotification failed: 0x02c2"}}));
  EXPECT_TRUE(alerts.AlertIsUp());
  EXPECT_FALSE(alerts.WatchesMedia());
  EXPECT_TRUE(service.current->attached);
}

}  // namespace
}  // namespace brisvale
