// One connection to the alert agent per alert. Nothing here waits for the agent: the
// connect fails at once when no agent listens or its backlog is full, the show frame
// goes out in one non-blocking send, and the answer is read on the main loop.
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "base/log.h"
#include "base/runloop.h"
#include "base/unique_fd.h"
#include "platform/linux/alert_linux.h"

namespace brisvale::alert {
namespace {

UniqueFd ConnectToAgent(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) return {};
  std::memcpy(address.sun_path, path.data(), path.size());
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) return {};
  int result;
  do {
    result = connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (result != 0 && errno == EINTR);
  if (result != 0) return {};
  return fd;
}

// Sends all of `frame` without waiting; false when the socket would not take it whole.
bool SendFrame(int fd, const plist::Bytes& frame) {
  ssize_t sent;
  do {
    sent = send(fd, frame.data(), frame.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  } while (sent < 0 && errno == EINTR);
  if (sent < 0) return false;
  if (static_cast<size_t>(sent) != frame.size()) {
    errno = EAGAIN;
    return false;
  }
  return true;
}

class AgentAlert final : public Alert {
 public:
  explicit AgentAlert(UniqueFd fd) : fd_(std::move(fd)) {}

  bool CreateResponseSource(ResponseHandler handler) override {
    if (!fd_ || handler_ || !handler) return false;
    handler_ = std::move(handler);
    return true;
  }

  void AttachResponseSource(RunLoop& loop) override {
    if (!handler_ || source_) return;
    source_ = loop.AddFd(fd_.get(), EPOLLIN | EPOLLRDHUP,
                         [this](uint32_t events) { OnReadable(events); });
  }

  long Cancel() override {
    source_.Reset();
    handler_ = nullptr;
    if (!fd_) return -ENOTCONN;
    long status = SendFrame(fd_.get(), EncodeCancelFrame()) ? 0 : -errno;
    fd_.Reset();
    return status;
  }

 private:
  void OnReadable(uint32_t) {
    // Small reads: a flooding agent is cut off after its first frame's worth.
    uint8_t chunk[256];
    ssize_t got = recv(fd_.get(), chunk, sizeof(chunk), MSG_DONTWAIT);
    if (got < 0 && (errno == EAGAIN || errno == EINTR)) return;
    if (got <= 0) {
      Log(Level::Default, "Alert agent closed the connection without an answer.");
      Finish(kResponseCancel);
      return;
    }
    Answer answer = reader_.Feed(std::span(chunk, static_cast<size_t>(got)));
    switch (answer.state) {
      case Answer::State::Incomplete:
        return;
      case Answer::State::Malformed:
        Log(Level::Default, "Alert agent sent a malformed answer (%s).", answer.problem);
        Finish(kResponseCancel);
        return;
      case Answer::State::Answered:
        Finish(answer.flags);
        return;
    }
  }

  // The handler may release this alert: nothing here is touched after it runs.
  void Finish(uint32_t flags) {
    source_.Reset();
    fd_.Reset();
    ResponseHandler handler = std::exchange(handler_, nullptr);
    if (handler) handler(*this, flags);
  }

  UniqueFd fd_;
  AnswerReader reader_;
  ResponseHandler handler_;
  SourceHandle source_;
};

}  // namespace

std::unique_ptr<Alert> CreateAgentAlert(const std::string& socketPath,
                                        const Description& description, AlertLevel level,
                                        std::optional<std::chrono::seconds> timeout) {
  UniqueFd fd = ConnectToAgent(socketPath);
  if (!fd) return nullptr;
  std::optional<uint32_t> seconds;
  if (timeout) seconds = static_cast<uint32_t>(std::max<int64_t>(timeout->count(), 0));
  if (!SendFrame(fd.get(), EncodeShowFrame(description, level, seconds))) return nullptr;
  return std::make_unique<AgentAlert>(std::move(fd));
}

}  // namespace brisvale::alert
