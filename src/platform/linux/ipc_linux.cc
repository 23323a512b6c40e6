#include "platform/linux/ipc_linux.h"

#include <atomic>
#include <utility>
#include <vector>

#include "base/log.h"
#include "base/runloop.h"
#include "platform/linux/ipc_connection.h"
#include "platform/linux/ipc_events.h"
#include "platform/linux/ipc_listener.h"
#include "platform/linux/ipc_socket.h"

namespace brisvale {
namespace {

constexpr char kActivatedEventsName[] = "events";

bool IsPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

class LinuxIpcService : public ipc::IpcService {
 public:
  LinuxIpcService(RunLoop& loop, IpcOptions options)
      : options_(std::move(options)),
        context_(std::make_shared<ipc::TransportContext>(loop, options_.partialFrameTimeout,
                                                         options_.outgoingQueueLimit)) {
    UniqueFd activatedEvents;
    for (ipc::ActivatedSocket& socket : ipc::TakeActivatedSockets()) {
      if (socket.name == kActivatedEventsName) {
        activatedEvents = std::move(socket.fd);
      } else {
        activated_.push_back(std::move(socket.fd));
      }
    }
    hub_ = std::make_shared<ipc::EventHub>(context_, EventsSocketPath(options_), options_.kernelDeviceEvents,
                                           std::move(activatedEvents));
  }

  ~LinuxIpcService() override {
    hub_->Shutdown();
    context_->Shutdown();
  }

  std::unique_ptr<ipc::Listener> CreateListener(std::string_view serviceName) override {
    if (!IsPlainName(serviceName)) {
      Log(Level::Default, "Refusing to listen on the service name \"%s\"", serviceName);
      return nullptr;
    }
    if (!activated_.empty()) {
      UniqueFd socket = std::move(activated_.front());
      activated_.erase(activated_.begin());
      Log(Level::Debug, "Serving %s on the socket passed by the launcher", serviceName);
      return std::make_unique<ipc::LinuxListener>(context_, std::move(socket), std::string());
    }
    const std::string path = ServiceSocketPath(options_, serviceName);
    std::string error;
    UniqueFd socket = ipc::ListenOnPath(path, &error);
    if (!socket) {
      Log(Level::Default, "Cannot listen on %s: %s", path, error);
      return nullptr;
    }
    return std::make_unique<ipc::LinuxListener>(context_, std::move(socket), path);
  }

  std::unique_ptr<ipc::EventStream> RegisterEventStream(
      std::string_view streamName, std::function<void(const ipc::StreamEvent& event)> handler) override {
    const uint64_t id = hub_->Add(std::string(streamName), std::move(handler));
    return std::make_unique<ipc::LinuxEventStream>(hub_, id);
  }

  void BeginTransaction() override { transactions_.fetch_add(1, std::memory_order_relaxed); }
  void EndTransaction() override { transactions_.fetch_sub(1, std::memory_order_relaxed); }
  int TransactionCount() const override { return transactions_.load(std::memory_order_relaxed); }

 private:
  IpcOptions options_;
  std::shared_ptr<ipc::TransportContext> context_;
  std::shared_ptr<ipc::EventHub> hub_;
  std::vector<UniqueFd> activated_;
  std::atomic<int> transactions_{0};
};

}  // namespace

std::string ServiceSocketPath(const IpcOptions& options, std::string_view serviceName) {
  return options.socketDirectory + "/" + std::string(serviceName);
}

std::string EventsSocketPath(const IpcOptions& options) {
  return options.eventsPath.empty() ? options.socketDirectory + "/events" : options.eventsPath;
}

std::unique_ptr<ipc::IpcService> CreateLinuxIpcService(RunLoop& loop, IpcOptions options) {
  return std::make_unique<LinuxIpcService>(loop, std::move(options));
}

}  // namespace brisvale
