// The daemon's serving state: the request listener, each client connection and the
// hardware event stream, all handled on the main loop one event at a time.
#pragma once

#include <functional>
#include <map>
#include <memory>

#include "daemon/matching_context.h"
#include "platform/ipc_service.h"

namespace brisvale {

class RunLoop;

inline constexpr const char* kServiceName = "com.vantrel.brisvale_mounter.vexa";
inline constexpr const char* kHardwareEventStream = "com.vantrel.kestrix.matching";
inline constexpr const char* kMediaAttachedEvent = "com.vantrel.brisvale_mounter.attached";
inline constexpr const char* kMediaDetachedEvent = "com.vantrel.brisvale_mounter.detached";
inline constexpr const char* kCameraEvent = "com.vantrel.mobile.ptp_camera";
inline constexpr const char* kStaleMountRoots[] = {"/var/mnt", "/private/var/factory_mount",
                                                   "/private/var/personalized_factory"};

class Daemon {
 public:
  // `exitProcess` ends the process; tests replace it. The transport, like every other
  // platform service, comes from CurrentServices().
  Daemon(RunLoop& loop, MatchingContext& context, std::function<void(int status)> exitProcess);

  // Creates the listener and registers the hardware event stream. Returns false after
  // logging when the listener cannot be created (the caller exits with status 1).
  bool StartServing();

  void HandleListenerEvent(std::shared_ptr<ipc::Connection> connection, ipc::EventKind kind);
  void HandleConnectionEvent(const std::shared_ptr<ipc::Connection>& connection,
                             ipc::EventKind kind, const ipc::Message* message);
  void HandleHardwareEvent(const ipc::StreamEvent& event);

  size_t ConnectionCount() const { return connections_.size(); }

 private:
  RunLoop& loop_;
  MatchingContext& context_;
  std::function<void(int)> exitProcess_;
  std::unique_ptr<ipc::Listener> listener_;
  std::unique_ptr<ipc::EventStream> hardwareEvents_;
  // Each connection is kept until it reports itself invalid.
  std::map<ipc::Connection*, std::shared_ptr<ipc::Connection>> connections_;
};

}  // namespace brisvale
