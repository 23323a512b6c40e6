// Named event streams of the Linux transport. Events come from two sources: root
// processes posting {"vexa.stream", "vexa.event"} frames on the events socket, and the
// kernel's device events, translated onto the hardware matching stream.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "base/runloop.h"
#include "platform/ipc_service.h"
#include "platform/linux/ipc_connection.h"
#include "base/unique_fd.h"
#include "platform/linux/ipc_listener.h"

namespace brisvale::ipc {

inline constexpr char kStreamKey[] = "vexa.stream";
inline constexpr char kEventKey[] = "vexa.event";

class EventHub : public std::enable_shared_from_this<EventHub> {
 public:
  using Handler = std::function<void(const StreamEvent& event)>;

  // `activatedSocket`, when valid, is the events listener a launcher passed.
  EventHub(std::shared_ptr<TransportContext> context, std::string eventsPath, bool kernelDeviceEvents,
           UniqueFd activatedSocket);

  // Registers `handler` for `stream`; the first registration opens the event sources.
  uint64_t Add(std::string stream, Handler handler);
  void Remove(uint64_t id);
  // Calls every handler registered for `stream`, in registration order.
  void Deliver(std::string_view stream, const StreamEvent& event);
  void Shutdown();

 private:
  void Start();
  void AcceptPoster(std::shared_ptr<Connection> connection);
  void HandlePosted(Connection& connection, const Message& message);
  void OpenKernelEvents();
  void ReadKernelEvents();

  std::shared_ptr<TransportContext> context_;
  std::string eventsPath_;
  bool kernelDeviceEvents_;
  UniqueFd activatedSocket_;
  bool started_ = false;

  uint64_t nextId_ = 1;
  std::map<uint64_t, std::pair<std::string, Handler>> registrations_;

  std::unique_ptr<LinuxListener> listener_;
  UniqueFd kernelSocket_;
  SourceHandle kernelSource_;
};

// Keeps one registration alive.
class LinuxEventStream : public EventStream {
 public:
  LinuxEventStream(std::weak_ptr<EventHub> hub, uint64_t id) : hub_(std::move(hub)), id_(id) {}
  ~LinuxEventStream() override {
    if (auto hub = hub_.lock()) hub->Remove(id_);
  }

 private:
  std::weak_ptr<EventHub> hub_;
  uint64_t id_;
};

}  // namespace brisvale::ipc
