#include "alert_agent.h"

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <list>
#include <utility>

#include "base/plist.h"
#include "base/unique_fd.h"
#include "json.h"
#include "platform/linux/alert_protocol.h"
#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_socket.h"

namespace brisvale::tools {
namespace {

using Clock = std::chrono::steady_clock;

// One alert: one connection from the daemon.
struct PendingAlert {
  int number = 0;
  UniqueFd fd;
  ipc::FrameReader reader;
  bool shown = false;
  std::optional<Clock::time_point> dismissAt;
};

class Agent {
 public:
  explicit Agent(const AlertAgentOptions& options) : options_(options) {}

  int Run() {
    std::string error;
    listener_ = ipc::ListenOnPath(options_.socketPath, &error);
    if (!listener_) {
      std::fprintf(stderr, "brisvalectl: %s\n", error.c_str());
      return 4;
    }
    Print("listening", 0, {{"socket", plist::Value(options_.socketPath)}},
          "waiting for alerts on " + options_.socketPath);
    for (;;) Serve();
  }

 private:
  void Serve() {
    std::vector<pollfd> fds{{listener_.get(), POLLIN, 0}};
    if (stdinOpen_) fds.push_back({STDIN_FILENO, POLLIN, 0});
    for (const PendingAlert& alert : alerts_) fds.push_back({alert.fd.get(), POLLIN, 0});
    if (poll(fds.data(), fds.size(), PollTimeout()) < 0 && errno != EINTR) return;

    DismissDue();
    if (fds[0].revents) Accept();
    if (stdinOpen_ && fds[1].revents) ReadStdin();
    // Connections by descriptor: the list may have changed above.
    for (const pollfd& entry : fds) {
      if (!entry.revents || entry.fd == listener_.get() || entry.fd == STDIN_FILENO) continue;
      for (auto it = alerts_.begin(); it != alerts_.end(); ++it) {
        if (it->fd.get() == entry.fd) {
          ReadDaemon(it);
          break;
        }
      }
    }
  }

  int PollTimeout() const {
    std::optional<Clock::time_point> next;
    for (const PendingAlert& alert : alerts_) {
      if (alert.dismissAt && (!next || *alert.dismissAt < *next)) next = alert.dismissAt;
    }
    if (!next) return -1;
    auto wait = std::chrono::duration_cast<std::chrono::milliseconds>(*next - Clock::now());
    return static_cast<int>(std::max<int64_t>(wait.count(), 0));
  }

  void Accept() {
    int fd = accept4(listener_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) return;
    PendingAlert alert;
    alert.number = ++lastNumber_;
    alert.fd.Reset(fd);
    alerts_.push_back(std::move(alert));
  }

  void ReadStdin() {
    char buffer[256];
    ssize_t got = read(STDIN_FILENO, buffer, sizeof buffer);
    if (got <= 0) {
      if (got == 0 || errno != EINTR) stdinOpen_ = false;
      return;
    }
    for (ssize_t i = 0; i < got; ++i) {
      if (buffer[i] != '\n') continue;
      // Enter answers the oldest alert on screen.
      for (auto it = alerts_.begin(); it != alerts_.end(); ++it) {
        if (it->shown) {
          Answer(it);
          break;
        }
      }
    }
  }

  void DismissDue() {
    auto now = Clock::now();
    for (auto it = alerts_.begin(); it != alerts_.end();) {
      auto next = std::next(it);
      if (it->dismissAt && *it->dismissAt <= now) Answer(it);
      it = next;
    }
  }

  void ReadDaemon(std::list<PendingAlert>::iterator it) {
    uint8_t buffer[4096];
    ssize_t got = recv(it->fd.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    if (got < 0 && (errno == EAGAIN || errno == EINTR)) return;
    std::vector<plist::Dictionary> frames;
    if (got <= 0 || it->reader.Feed(std::span(buffer, static_cast<size_t>(got)), frames)) {
      // The daemon went away or spoke nonsense: the alert is no longer wanted.
      if (it->shown) Print("cancelled", it->number, {}, "cancelled");
      alerts_.erase(it);
      return;
    }
    for (const plist::Dictionary& frame : frames) {
      const plist::Value* type = frame.find("Type");
      const std::string* name = type ? type->string() : nullptr;
      if (name && *name == "Show" && !it->shown) {
        Show(*it, frame);
      } else if (name && *name == "Cancel") {
        if (it->shown) Print("cancelled", it->number, {}, "cancelled");
        alerts_.erase(it);
        return;
      }
    }
  }

  void Show(PendingAlert& alert, const plist::Dictionary& frame) {
    alert.shown = true;
    if (options_.autoDismissSeconds) {
      alert.dismissAt = Clock::now() + std::chrono::seconds(*options_.autoDismissSeconds);
    }
    auto text = [&](const char* key) -> std::string {
      const plist::Value* value = frame.find(key);
      return value && value->string() ? *value->string() : std::string();
    };
    plist::Dictionary fields;
    for (auto [key, name] : {std::pair{"Title", "title"}, std::pair{"Message", "message"},
                             std::pair{"DefaultButtonTitle", "button"}}) {
      if (const plist::Value* value = frame.find(key)) fields.set(name, *value);
    }
    std::string button = text("DefaultButtonTitle").empty() ? "OK" : text("DefaultButtonTitle");
    Print("shown", alert.number, fields,
          text("Title") + "\n    " + text("Message") + "\n    [" + button + "] press Enter");
  }

  void Answer(std::list<PendingAlert>::iterator it) {
    plist::Bytes frame = alert::EncodeResponseFrame(alert::kResponseDefault);
    (void)send(it->fd.get(), frame.data(), frame.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    Print("answered", it->number, {}, "answered");
    alerts_.erase(it);
  }

  void Print(const char* event, int number, plist::Dictionary fields, const std::string& text) {
    if (options_.json) {
      fields.set("event", plist::Value(event));
      if (number) fields.set("alert", plist::Value::Int(number));
      // One line: drop the line breaks and the indentation after them.
      std::string line;
      bool indent = false;
      for (char c : ToJson(plist::Value(fields))) {
        if (c == '\n') {
          indent = true;
        } else if (!(indent && c == ' ')) {
          indent = false;
          line += c;
        }
      }
      std::printf("%s\n", line.c_str());
    } else if (number) {
      std::printf("[alert %d] %s\n", number, text.c_str());
    } else {
      std::printf("%s\n", text.c_str());
    }
    std::fflush(stdout);
  }

  const AlertAgentOptions& options_;
  UniqueFd listener_;
  bool stdinOpen_ = true;
  int lastNumber_ = 0;
  std::list<PendingAlert> alerts_;
};

}  // namespace

int RunAlertAgent(const AlertAgentOptions& options) { return Agent(options).Run(); }

}  // namespace brisvale::tools
