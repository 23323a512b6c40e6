#include "daemon/daemon.h"

#include "base/log.h"
#include "base/runloop.h"
#include "daemon/dispatcher.h"
#include "daemon/request_handlers.h"
#include "platform/device_registry.h"
#include "platform/services.h"

namespace brisvale {
namespace {

const char* NameOr(const std::optional<std::string>& text) { return text ? text->c_str() : nullptr; }

// Devices attached a moment ago must be in the registry before anything looks there.
void RefreshRegistry(registry::RefreshReason reason) {
  if (registry::DeviceRegistry* registry = CurrentServices().registry) registry->Refresh(reason);
}

}  // namespace

Daemon::Daemon(RunLoop& loop, MatchingContext& context, std::function<void(int)> exitProcess)
    : loop_(loop), context_(context), exitProcess_(std::move(exitProcess)) {}

bool Daemon::StartServing() {
  ipc::IpcService& ipc = *CurrentServices().ipc;
  listener_ = ipc.CreateListener(kServiceName);
  if (!listener_) {
    Log(Level::Default, "Failed to create vexa listener for %s.", kServiceName);
    return false;
  }
  listener_->Resume([this](std::shared_ptr<ipc::Connection> connection, ipc::EventKind kind) {
    HandleListenerEvent(std::move(connection), kind);
  });
  hardwareEvents_ = ipc.RegisterEventStream(
      kHardwareEventStream, [this](const ipc::StreamEvent& event) { HandleHardwareEvent(event); });
  return true;
}

void Daemon::HandleListenerEvent(std::shared_ptr<ipc::Connection> connection,
                                 ipc::EventKind kind) {
  if (connection) {
    if (log::DebugEnabled()) {
      Log(Level::Debug, "new vexa connection: %@", NameOr(CopyClientName(connection.get())));
    }
    connections_[connection.get()] = connection;
    std::weak_ptr<ipc::Connection> weak = connection;
    connection->Resume([this, weak](ipc::EventKind event, const ipc::Message* message) {
      if (std::shared_ptr<ipc::Connection> live = weak.lock()) {
        HandleConnectionEvent(live, event, message);
      }
    });
    return;
  }
  if (kind == ipc::EventKind::ConnectionInvalid) {
    Log(Level::Error,
        "vexa connection listener is invalid. Verify mach service name %s is set in vexa plist.",
        kServiceName);
    exitProcess_(1);
  }
}

void Daemon::HandleConnectionEvent(const std::shared_ptr<ipc::Connection>& connection,
                                   ipc::EventKind kind, const ipc::Message* message) {
  if (kind == ipc::EventKind::Message && message) {
    RefreshRegistry(registry::RefreshReason::Request);
    if (!HandleRequest(context_, connection.get(), *message)) connection->Cancel();
    return;
  }
  if (kind == ipc::EventKind::ConnectionInvalid) {
    if (log::DebugEnabled()) {
      Log(Level::Debug, "connection closed: %@", NameOr(CopyClientName(connection.get())));
    }
    // Dropped after this handler returns: the connection is still on the call stack.
    ipc::Connection* key = connection.get();
    loop_.Post([this, key] { connections_.erase(key); });
  }
}

void Daemon::HandleHardwareEvent(const ipc::StreamEvent& event) {
  if (!event.name) return;
  RefreshRegistry(registry::RefreshReason::HardwareEvent);
  const std::string& name = *event.name;
  Log(Level::Debug, "Kestrix Event: %@", name);
  if (name == kCameraEvent) {
    SubscribeCameraAttach(context_);
  } else if (name == kMediaAttachedEvent) {
    SubscribeMediaAttach(context_);
  } else if (name == kMediaDetachedEvent) {
    HandleMediaDetached();
  } else {
    Log(Level::Debug, "Unsupported Kestrix Event: %@", name);
  }
}

}  // namespace brisvale
