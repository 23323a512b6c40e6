#include "platform/linux/ipc_events.h"

#include <errno.h>
#include <linux/netlink.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <array>
#include <vector>

#include "base/log.h"
#include "platform/linux/ipc_socket.h"
#include "platform/linux/ipc_uevent.h"

namespace brisvale::ipc {
namespace {

constexpr uint32_t kKernelEventGroup = 1;
constexpr int kKernelReceiveBuffer = 1 << 20;
constexpr int kKernelEventsPerWakeup = 64;

}  // namespace

EventHub::EventHub(std::shared_ptr<TransportContext> context, std::string eventsPath, bool kernelDeviceEvents,
                   UniqueFd activatedSocket)
    : context_(std::move(context)),
      eventsPath_(std::move(eventsPath)),
      kernelDeviceEvents_(kernelDeviceEvents),
      activatedSocket_(std::move(activatedSocket)) {}

uint64_t EventHub::Add(std::string stream, Handler handler) {
  const uint64_t id = nextId_++;
  registrations_.emplace(id, std::make_pair(std::move(stream), std::move(handler)));
  if (!started_) Start();
  return id;
}

void EventHub::Remove(uint64_t id) { registrations_.erase(id); }

void EventHub::Deliver(std::string_view stream, const StreamEvent& event) {
  std::vector<uint64_t> ids;
  for (const auto& [id, registration] : registrations_) {
    if (registration.first == stream) ids.push_back(id);
  }
  for (uint64_t id : ids) {
    // A handler may remove registrations, its own included.
    auto found = registrations_.find(id);
    if (found == registrations_.end()) continue;
    Handler handler = found->second.second;
    handler(event);
  }
}

void EventHub::Shutdown() {
  registrations_.clear();
  listener_.reset();
  kernelSource_.Reset();
  kernelSocket_.Reset();
}

void EventHub::Start() {
  started_ = true;
  UniqueFd socket = std::move(activatedSocket_);
  std::string ownedPath;
  if (!socket) {
    std::string error;
    socket = ListenOnPath(eventsPath_, &error);
    if (!socket) {
      Log(Level::Default, "Cannot listen for posted events: %s", error);
    }
    ownedPath = eventsPath_;
  }
  if (socket) {
    listener_ = std::make_unique<LinuxListener>(context_, std::move(socket), ownedPath);
    std::weak_ptr<EventHub> weakHub = weak_from_this();
    listener_->Resume([weakHub](std::shared_ptr<Connection> connection, EventKind) {
      auto hub = weakHub.lock();
      if (!hub) return;
      if (!connection) {
        Log(Level::Default, "The posted-event listener failed");
        return;
      }
      hub->AcceptPoster(std::move(connection));
    });
  }
  if (kernelDeviceEvents_) OpenKernelEvents();
}

void EventHub::AcceptPoster(std::shared_ptr<Connection> connection) {
  if (connection->PeerUid() != 0) {
    // Dropping the only reference closes the socket before anything is read.
    Log(Level::Default, "Refusing an event poster that is not root (pid %d, uid %u)",
        static_cast<int>(connection->PeerPid()), static_cast<unsigned>(connection->PeerUid()));
    return;
  }
  std::weak_ptr<EventHub> weakHub = weak_from_this();
  std::weak_ptr<Connection> weakConnection = connection;
  connection->Resume([weakHub, weakConnection](EventKind kind, const Message* message) {
    auto hub = weakHub.lock();
    auto connection = weakConnection.lock();
    if (hub && connection && kind == EventKind::Message && message) hub->HandlePosted(*connection, *message);
  });
}

void EventHub::HandlePosted(Connection& connection, const Message& message) {
  const plist::Value* stream = message.body.find(kStreamKey);
  if (!stream || !stream->string()) {
    Log(Level::Default, "Ignoring a posted event without a stream name from pid %d",
        static_cast<int>(connection.PeerPid()));
    connection.Cancel();
    return;
  }
  StreamEvent event;
  if (const plist::Value* name = message.body.find(kEventKey); name && name->string()) {
    event.name = *name->string();
  }
  // The stream name is copied: a handler may end this connection and its message.
  const std::string streamName = *stream->string();
  const std::optional<plist::Integer> token = message.replyToken;
  Deliver(streamName, event);
  if (token) {
    // The acknowledgement tells the poster that its event has been handled.
    Message acknowledgement;
    acknowledgement.replyToken = token;
    acknowledgement.isReply = true;
    connection.Send(acknowledgement);
  }
}

void EventHub::OpenKernelEvents() {
  kernelSocket_.Reset(socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_KOBJECT_UEVENT));
  if (!kernelSocket_) {
    Log(Level::Default, "Cannot open the kernel device event socket: %{errno}d", errno);
    return;
  }
  // Attach storms (a hub with many disks) must not overflow the queue.
  if (setsockopt(kernelSocket_.get(), SOL_SOCKET, SO_RCVBUFFORCE, &kKernelReceiveBuffer,
                 sizeof(kKernelReceiveBuffer)) != 0) {
    setsockopt(kernelSocket_.get(), SOL_SOCKET, SO_RCVBUF, &kKernelReceiveBuffer, sizeof(kKernelReceiveBuffer));
  }
  sockaddr_nl address{};
  address.nl_family = AF_NETLINK;
  address.nl_groups = kKernelEventGroup;
  if (bind(kernelSocket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
    Log(Level::Default, "Cannot listen to kernel device events: %{errno}d", errno);
    kernelSocket_.Reset();
    return;
  }
  kernelSource_ = context_->loop.AddFd(kernelSocket_.get(), EPOLLIN, [this](uint32_t) { ReadKernelEvents(); });
}

void EventHub::ReadKernelEvents() {
  auto self = shared_from_this();  // a handler may end the service
  std::array<uint8_t, 8192> buffer;
  for (int i = 0; i < kKernelEventsPerWakeup; ++i) {
    sockaddr_nl sender{};
    iovec io{buffer.data(), buffer.size()};
    msghdr header{};
    header.msg_name = &sender;
    header.msg_namelen = sizeof(sender);
    header.msg_iov = &io;
    header.msg_iovlen = 1;
    const ssize_t count = recvmsg(kernelSocket_.get(), &header, MSG_DONTWAIT);
    if (count < 0) {
      if (errno == EINTR) continue;
      if (errno == ENOBUFS) {
        Log(Level::Default, "Kernel device events were lost: the receive queue overflowed");
        continue;
      }
      if (errno != EAGAIN) Log(Level::Default, "Reading kernel device events failed: %{errno}d", errno);
      return;
    }
    // Only the kernel itself (port 0) speaks for devices; truncated datagrams are dropped.
    if (sender.nl_pid != 0 || (header.msg_flags & MSG_TRUNC)) continue;
    std::optional<std::string> name =
        MatchingEventForUevent(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(count)));
    if (!name) continue;
    Log(Level::Debug, "Kernel device event: %s", *name);
    StreamEvent event;
    event.name = std::move(name);
    Deliver(kMatchingStream, event);
    if (!kernelSocket_) return;
  }
}

}  // namespace brisvale::ipc
