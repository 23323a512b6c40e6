// User alerts (media/user_alerts) over the real alert service of a scratch root: what is
// shown, read off the agent socket; what is dropped; what takes an alert down; agents
// that misbehave or are missing; the preference file. (The console agent is exercised
// with the daemon, in tests/integration/media.)
#include <sys/socket.h>
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "base/log.h"
#include "base/runloop.h"
#include "media/user_alerts.h"
#include "platform/linux/alert_linux.h"
#include "platform/linux/ipc_socket.h"
#include "platform/services.h"
#include "registry/registry_model.h"
#include "test_files.h"

namespace brisvale {
namespace {

using namespace std::chrono_literals;
using Lines = std::vector<std::string>;

// The next frame on the agent's end of an alert's connection, decoded; empty on timeout.
plist::Dictionary ReadFrame(int agent) {
  uint8_t header[4];
  if (recv(agent, header, sizeof header, MSG_WAITALL) != 4) return {};
  plist::Bytes payload(uint32_t{header[0]} << 24 | uint32_t{header[1]} << 16 | uint32_t{header[2]} << 8 | header[3]);
  if (recv(agent, payload.data(), payload.size(), MSG_WAITALL) != static_cast<ssize_t>(payload.size())) return {};
  const std::optional<plist::Value> frame = plist::Read(payload);
  return frame && frame->dictionary() ? *frame->dictionary() : plist::Dictionary{};
}

struct AlertsTest : ::testing::Test {
  AlertsTest() {
    std::string error;
    EXPECT_TRUE(alert::InstallLocalizationBundle(root.str(), &error)) << error;
  }
  // The agent's end of the next alert's connection, reads bounded by a timeout.
  static UniqueFd Accept(const UniqueFd& listener, int flags = 0) {
    UniqueFd agent(accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC | flags));
    const timeval timeout{5, 0};
    if (agent) setsockopt(agent.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    return agent;
  }
  registry::ObjectRef Medium() { return registry.Publish(nullptr, "KxMedia", {{"BSD Name", plist::Value("sdb1")}}); }

  brisvale::testing::ScratchDir root;
  log::CaptureSink log;
  RunLoop loop;
  std::unique_ptr<alert::UserAlertService> service =
      alert::CreateLinuxUserAlertService(loop, {root.str() + alert::kAlertAgentSocketPath, root.str()});
  registry::RegistryModel registry;
  ScopedServices services{Services{&registry, nullptr, nullptr, nullptr, service.get()}};
  UserAlerts alerts;
};

// Only a boolean, read once from the domain's own regular file, switches alerts off: a
// link or a FIFO in its place reads as absent (and the FIFO does not hold the daemon up).
// With no agent listening, an alert that is tried fails to be created.
TEST_F(AlertsTest, OnlyABooleanInThePreferenceFileSwitchesAlertsOff) {
  const std::string file = root.str() + "/var/mobile/Library/Preferences/com.vantrel.mobile.device_o_matic.plist";
  std::filesystem::create_directories(std::filesystem::path(file).parent_path());
  const std::string tried = "Failed to create user notification.";
  const std::string disabled =
      "Dialogs are disabled because DISABLE_DIALOGS preference was set in com.vantrel.mobile.device_o_matic.";
  struct Case {
    const char* name;
    std::optional<plist::Value> value;
    const char* placed;  // "file", "link" or "fifo"
    Lines lines;
  };
  const Case cases[] = {
      {"true", plist::Value::Bool(true), "file", {disabled, "Dialogs are disabled.", "Dialogs are disabled."}},
      {"a string", plist::Value("YES"), "file", {tried, tried}},
      {"true behind a link", plist::Value::Bool(true), "link", {tried, tried}},
      {"a FIFO", std::nullopt, "fifo", {tried, tried}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string written = std::string(c.placed) == "link" ? root.str() + "/elsewhere.plist" : file;
    if (c.value) std::ofstream(written) << plist::WriteXml(plist::Dictionary{{"DISABLE_DIALOGS", *c.value}});
    if (std::string(c.placed) == "link") std::filesystem::create_symlink(written, file);
    if (std::string(c.placed) == "fifo") {
      ASSERT_EQ(mkfifo(file.c_str(), 0644), 0);
    }
    UserAlerts fresh;
    log.Clear();
    for (int i = 0; i < 2; ++i) {
      fresh.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", nullptr);
      loop.RunFor(5ms);
      std::filesystem::remove(file);  // the second alert goes by the first reading
    }
    EXPECT_EQ(log.Texts(), c.lines);
  }
  EXPECT_EQ(service->CopyPreference("DISABLE_DIALOGS", "../../../elsewhere", "mobile"), std::nullopt);
}

// Without an agent or without the string bundle, nothing is shown and no alert is left.
TEST_F(AlertsTest, FailuresShowNothingAndLeaveNoAlert) {
  const auto showsOnly = [&](const std::string& line) {
    log.Clear();
    alerts.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", Medium());
    loop.RunFor(20ms);
    EXPECT_EQ(log.Lines(), (std::vector<log::Line>{{Level::Default, line}}));
    EXPECT_FALSE(alerts.AlertIsUp() || alerts.WatchesMedia());
  };
  showsOnly("Failed to create user notification.");  // no agent
  std::filesystem::remove_all(root / "System");
  showsOnly("Failed to create bundle.");
}

// Each agent takes the alert and then does one thing; whatever it does takes the alert
// down and ends the watch on its medium.
TEST_F(AlertsTest, OneAlertAtATimeUntilWhatTheAgentDoesTakesItDown) {
  const plist::Bytes frame = alert::EncodeResponseFrame(0);
  const std::string answer(frame.begin(), frame.end());
  const plist::Dictionary shown{
      {"Type", plist::Value("Show")}, {"TopMost", plist::Value::Bool(true)}, {"Level", plist::Value::Int(0)},
      {"Timeout", plist::Value::Int(0)}, {"Title", plist::Value("NO_TEXT_TITLE")},  // a key without a text
      {"Message", plist::Value("The connected storage device could not be opened. Its format may not be supported "
                               "here. Reformat it on a computer, then connect it again.")}};
  enum Action { kSends, kHangsUp, kMediumPulled, kMediumPulledAfterAgentStoppedReading };
  struct Case {
    const char* name;
    Action action;
    std::string sends;
    Lines lines;
  };
  const Case cases[] = {
      {"answers twice", kSends, answer + answer, {}},
      {"huge frame", kSends, std::string("\xff\xff\xff\xff", 4), {"Alert agent sent a malformed answer (frame length 4294967295)."}},
      {"not a property list", kSends, std::string("\0\0\0\x05hello", 9),
       {"Alert agent sent a malformed answer (undecodable: too short for a binary property list)."}},
      {"hangs up", kHangsUp, "", {"Alert agent closed the connection without an answer."}},
      {"medium pulled", kMediumPulled, "", {}},
      {"medium pulled, agent not reading", kMediumPulledAfterAgentStoppedReading, "", {"Failed to cancel user notification: -32"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    // Plays the agent: listens where the service looks for one.
    std::string error;
    UniqueFd listener = ipc::ListenOnPath(root.str() + alert::kAlertAgentSocketPath, &error);
    ASSERT_TRUE(listener) << error;
    const registry::ObjectRef medium = Medium();
    log.Clear();
    alerts.Show("NO_TEXT_TITLE", "MOUNT_FAILURE_BODY", nullptr, medium);
    alerts.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", medium);
    EXPECT_FALSE(Accept(listener, SOCK_NONBLOCK)) << "shown before the main loop ran";
    loop.RunFor(20ms);
    UniqueFd agent = Accept(listener);
    EXPECT_EQ(ReadFrame(agent.get()), shown);
    EXPECT_EQ(log.Lines(), (std::vector<log::Line>{{Level::Debug, "Dialog already up, one is enough."}}));
    ASSERT_TRUE(alerts.AlertIsUp() && alerts.WatchesMedia());
    log.Clear();
    if (c.action == kSends) {
      ASSERT_EQ(send(agent.get(), c.sends.data(), c.sends.size(), MSG_NOSIGNAL), static_cast<ssize_t>(c.sends.size()));
    } else if (c.action == kHangsUp) {
      agent.Reset();
    } else {
      if (c.action == kMediumPulledAfterAgentStoppedReading) shutdown(agent.get(), SHUT_RD);
      registry.Terminate(medium);
    }
    loop.RunFor(50ms);
    EXPECT_FALSE(alerts.AlertIsUp() || alerts.WatchesMedia());
    EXPECT_EQ(log.Texts(), c.lines);
    if (c.action == kMediumPulled) {
      EXPECT_EQ(*ReadFrame(agent.get()).find("Type"), plist::Value("Cancel"));
    } else if (c.action == kSends) {
      registry.Terminate(medium);  // the watch went with the answer: nothing to cancel
      loop.RunFor(20ms);
      EXPECT_EQ(ReadFrame(agent.get()), plist::Dictionary{});
    }
  }
}

}  // namespace
}  // namespace brisvale
