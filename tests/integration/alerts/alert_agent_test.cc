// Alerts through the real agent socket of a scratch root: shown, answered and cancelled
// with `brisvalectl alert-agent`; agents that misbehave; no agent at all.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

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

namespace brisvale {
namespace {

using namespace std::chrono_literals;

// `brisvalectl alert-agent --json` with its stdin and stdout on pipes.
class AgentProcess {
 public:
  explicit AgentProcess(const std::string& root) {
    int in[2], out[2];
    if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(in[0], STDIN_FILENO);
      dup2(out[1], STDOUT_FILENO);
      execl(BRISVALECTL, BRISVALECTL, "--root", root.c_str(), "--json", "alert-agent", nullptr);
      _exit(127);
    }
    close(in[0]);
    close(out[1]);
    stdin_.Reset(in[1]);
    stdout_.Reset(out[0]);
    fcntl(stdout_.get(), F_SETFL, O_NONBLOCK);
  }
  ~AgentProcess() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
  }
  void PressEnter() { ASSERT_EQ(write(stdin_.get(), "\n", 1), 1); }
  // Runs `loop` until the agent prints a line with `"event": "<event>"`; that line.
  std::string WaitFor(RunLoop& loop, const std::string& event) {
    const std::string wanted = "\"event\": \"" + event + "\"";
    for (auto end = std::chrono::steady_clock::now() + 5s; std::chrono::steady_clock::now() < end;) {
      char buffer[4096];
      ssize_t got = read(stdout_.get(), buffer, sizeof buffer);
      if (got > 0) output_.append(buffer, static_cast<size_t>(got));
      for (size_t newline; (newline = output_.find('\n')) != std::string::npos;) {
        std::string line = output_.substr(0, newline);
        output_.erase(0, newline + 1);
        if (line.find(wanted) != std::string::npos) return line;
      }
      loop.RunFor(10ms);
    }
    return "(no " + event + " line)";
  }

 private:
  pid_t pid_ = -1;
  UniqueFd stdin_, stdout_;
  std::string output_;
};

struct AlertAgentTest : ::testing::Test {
  AlertAgentTest() {
    char dir[] = "/tmp/brisvale-alerts-XXXXXX";
    root = ::mkdtemp(dir);
    std::string error;
    EXPECT_TRUE(alert::InstallLocalizationBundle(root, &error)) << error;
    service = alert::CreateLinuxUserAlertService(
        loop, {root + alert::kAlertAgentSocketPath, root});
    CurrentServices().alerts = service.get();
  }
  ~AlertAgentTest() override { std::filesystem::remove_all(root); }

  registry::ObjectRef Medium() {
    return registry.Publish(nullptr, "KxMedia", {{"BSD Name", plist::Value("sdb1")}});
  }
  void ShowMountFailure(const registry::ObjectRef& medium) {
    alerts.Show("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", medium);
    loop.RunFor(20ms);
  }
  bool RunUntilAlertDown() { return loop.RunUntil([&] { return !alerts.AlertIsUp(); }, 5s); }

  std::string root;
  log::CaptureSink log;
  RunLoop loop;
  std::unique_ptr<alert::UserAlertService> service;
  registry::RegistryModel registry;
  ScopedServices services{Services{&registry, nullptr, nullptr, nullptr, nullptr}};
  UserAlerts alerts;
};

TEST_F(AlertAgentTest, ConsoleAgentShowsAnswersAndTakesDownAlerts) {
  AgentProcess agent(root);
  ASSERT_NE(agent.WaitFor(loop, "listening"), "(no listening line)");

  ShowMountFailure(Medium());
  std::string shown = agent.WaitFor(loop, "shown");
  EXPECT_NE(shown.find("\"title\": \"Cannot Use Storage Device\""), std::string::npos) << shown;
  EXPECT_NE(shown.find("\"button\": \"OK\""), std::string::npos) << shown;
  agent.PressEnter();
  EXPECT_TRUE(RunUntilAlertDown());
  EXPECT_FALSE(alerts.WatchesMedia());
  EXPECT_NE(agent.WaitFor(loop, "answered"), "(no answered line)");

  registry::ObjectRef medium = Medium();
  ShowMountFailure(medium);
  EXPECT_NE(agent.WaitFor(loop, "shown"), "(no shown line)");
  registry.Terminate(medium);
  EXPECT_TRUE(RunUntilAlertDown());
  EXPECT_NE(agent.WaitFor(loop, "cancelled"), "(no cancelled line)");
  EXPECT_TRUE(log.Lines().empty()) << log.Texts()[0];
}

// Each agent accepts the alert and then does one thing: says nothing, answers with
// bytes that are not an answer, answers twice, or hangs up. Then no agent is left.
TEST_F(AlertAgentTest, MisbehavingAgentsCannotHoldOrConfuseTheAlerts) {
  const std::string answer = [] {
    plist::Bytes frame = alert::EncodeResponseFrame(0);
    return std::string(frame.begin(), frame.end());
  }();
  struct Case {
    const char* name;
    std::optional<std::string> sends;  // none: hangs up
    bool staysUp;
    std::vector<std::string> lines;
  };
  const Case cases[] = {
      {"silent", std::string(), true, {}},
      {"huge frame", std::string("\xff\xff\xff\xff", 4), false,
       {"Alert agent sent a malformed answer (frame length 4294967295)."}},
      {"not a property list", std::string("\0\0\0\x05hello", 9), false,
       {"Alert agent sent a malformed answer (undecodable: too short for a binary property list)."}},
      {"twice", answer + answer, false, {}},
      {"hangs up", std::nullopt, false, {"Alert agent closed the connection without an answer."}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::string error;
    UniqueFd listener = ipc::ListenOnPath(root + alert::kAlertAgentSocketPath, &error);
    ASSERT_TRUE(listener) << error;
    ShowMountFailure(Medium());
    ASSERT_TRUE(alerts.AlertIsUp());
    UniqueFd peer(accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
    ASSERT_TRUE(peer);
    log.Clear();
    if (c.sends) {
      ASSERT_EQ(send(peer.get(), c.sends->data(), c.sends->size(), MSG_NOSIGNAL),
                static_cast<ssize_t>(c.sends->size()));
    } else {
      peer.Reset();
    }
    loop.RunFor(50ms);
    EXPECT_EQ(alerts.AlertIsUp(), c.staysUp);
    EXPECT_EQ(log.Texts(), c.lines);
    // The next request is still served: dropped while one is up, and tried (with no
    // agent left to show it) once it is gone.
    listener.Reset();
    alerts.Show("MOUNT_FAILURE_TITLE", nullptr, nullptr, nullptr);
    loop.RunFor(20ms);
    EXPECT_EQ(log.Texts().back(), c.staysUp ? "Dialog already up, one is enough."
                                            : "Failed to create user notification.")
        << "after " << c.name;
    if (c.staysUp) {
      peer.Reset();  // the silent agent finally goes away
      ASSERT_TRUE(RunUntilAlertDown());
    }
  }
}

// Only a regular file is read: a link or a FIFO planted in its place reads as absent
// (and the FIFO does not hold the daemon up).
TEST_F(AlertAgentTest, PreferenceComesFromTheDomainFileOnly) {
  const std::string directory = root + "/var/mobile/Library/Preferences";
  const std::string file = directory + "/com.vantrel.mobile.device_o_matic.plist";
  std::filesystem::create_directories(directory);
  auto read = [&] {
    return service->CopyPreference("DISABLE_DIALOGS", "com.vantrel.mobile.device_o_matic", "mobile");
  };
  EXPECT_EQ(read(), std::nullopt);
  ASSERT_EQ(mkfifo(file.c_str(), 0644), 0);
  EXPECT_EQ(read(), std::nullopt);
  std::filesystem::remove(file);
  const std::string real = root + "/elsewhere.plist";
  std::ofstream(real) << plist::WriteXml(
      plist::Dictionary{{"DISABLE_DIALOGS", plist::Value::Bool(true)}});
  std::filesystem::create_symlink(real, file);
  EXPECT_EQ(read(), std::nullopt);
  std::filesystem::rename(real, file);
  EXPECT_EQ(read(), plist::Value::Bool(true));
  EXPECT_EQ(service->CopyPreference("DISABLE_DIALOGS", "../../../elsewhere", "mobile"), std::nullopt);
}

}  // namespace
}  // namespace brisvale
