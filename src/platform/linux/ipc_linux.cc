#include "platform/linux/ipc_linux.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <utility>
#include <vector>

#include "base/log.h"
#include "base/runloop.h"
#include "base/unique_fd.h"
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

// The transaction counter, in a shared mapping of the export file when there is one and
// in the process otherwise. The file goes with the service; one left by a daemon that was
// killed keeps its last count until the next start resets it.
class TransactionCounter {
 public:
  TransactionCounter() = default;
  // Moves the count into a shared mapping of `path`; it stays in the process when that
  // fails.
  void ExportTo(std::string path) {
    path_ = std::move(path);
    UniqueFd fd(::open(path_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0644));
    void* page = MAP_FAILED;
    if (fd && ::ftruncate(fd.get(), sizeof(int32_t)) == 0) {
      page = ::mmap(nullptr, sizeof(int32_t), PROT_READ | PROT_WRITE, MAP_SHARED, fd.get(), 0);
    }
    if (page == MAP_FAILED) {
      Log(Level::Default, "Cannot export the transaction count at %s: %{errno}d", path_, errno);
      path_.clear();
      return;
    }
    shared_ = static_cast<int32_t*>(page);
    *shared_ = local_;
  }
  ~TransactionCounter() {
    if (!shared_) return;
    ::munmap(shared_, sizeof(int32_t));
    ::unlink(path_.c_str());
  }
  TransactionCounter(const TransactionCounter&) = delete;
  TransactionCounter& operator=(const TransactionCounter&) = delete;

  std::atomic_ref<int32_t> value() const { return std::atomic_ref<int32_t>(shared_ ? *shared_ : local_); }

 private:
  std::string path_;
  int32_t* shared_ = nullptr;
  alignas(std::atomic_ref<int32_t>::required_alignment) mutable int32_t local_ = 0;
};

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
    // After the event hub, which creates the socket directory the file usually lives in.
    if (!options_.transactionCountPath.empty()) transactions_.ExportTo(options_.transactionCountPath);
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

  void BeginTransaction() override { transactions_.value().fetch_add(1, std::memory_order_relaxed); }
  void EndTransaction() override { transactions_.value().fetch_sub(1, std::memory_order_relaxed); }
  int TransactionCount() const override { return transactions_.value().load(std::memory_order_relaxed); }

 private:
  IpcOptions options_;
  TransactionCounter transactions_;
  std::shared_ptr<ipc::TransportContext> context_;
  std::shared_ptr<ipc::EventHub> hub_;
  std::vector<UniqueFd> activated_;
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
