// The Linux message transport: Unix stream sockets carrying length-prefixed frames,
// served on one RunLoop. Named services listen in a socket directory (or on the socket
// a launcher passes by activation); hardware events arrive from root posters on the
// events socket and from the kernel's own device events.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>
#include <string_view>

#include "platform/ipc_service.h"

namespace brisvale {

class RunLoop;

struct IpcOptions {
  // A service name maps to "<socketDirectory>/<service name>".
  std::string socketDirectory = "/var/run/vexa";
  // Where root posters deliver stream events; empty means "<socketDirectory>/events".
  std::string eventsPath;
  // A connection that sends part of a frame and then nothing for this long is cancelled.
  std::chrono::milliseconds partialFrameTimeout{10'000};
  // Bytes a connection may have waiting for its peer to read before it is cancelled.
  size_t outgoingQueueLimit = size_t{8} << 20;
  // Translate kernel device events into the hardware matching stream.
  bool kernelDeviceEvents = true;
  // Where the keep-alive transaction count is exported for the launcher: a file holding
  // one native-endian 32-bit signed integer at offset 0, shared-mapped so that the count
  // is always current without a write per change. Empty: not exported.
  std::string transactionCountPath;
};

// The socket path that serves `serviceName` under `options`.
std::string ServiceSocketPath(const IpcOptions& options, std::string_view serviceName);
std::string EventsSocketPath(const IpcOptions& options);

// Everything the service creates is served on `loop`, which must outlive it. Takes the
// descriptors passed by socket activation, if any, for its listeners.
std::unique_ptr<ipc::IpcService> CreateLinuxIpcService(RunLoop& loop, IpcOptions options = {});

}  // namespace brisvale
