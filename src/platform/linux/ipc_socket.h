// Listening sockets for the transport: named Unix stream sockets in the socket
// directory, or the descriptors a launcher passes by socket activation.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "base/unique_fd.h"

namespace brisvale::ipc {

// Binds and listens on `path` (non-blocking, close-on-exec, mode 0666), creating its
// directory (0755) when missing. A socket file left by a process that is gone is
// replaced; one that a live process still serves is not, and the call fails. On failure
// returns an empty fd and says why in `error`.
UniqueFd ListenOnPath(const std::string& path, std::string* error);

// A listening descriptor passed by the launcher (LISTEN_PID/LISTEN_FDS/LISTEN_FDNAMES).
struct ActivatedSocket {
  UniqueFd fd;
  std::string name;  // from LISTEN_FDNAMES; empty when none was given
};

// Takes the descriptors passed to this process, made non-blocking and close-on-exec,
// and clears the variables so that children do not see them. Empty when the variables
// are absent or meant for another process; descriptors that are not listening Unix
// stream sockets are left out.
std::vector<ActivatedSocket> TakeActivatedSockets();

// Connects a non-blocking stream socket to `path`; empty fd with `error` on failure.
UniqueFd ConnectToPath(std::string_view path, std::string* error);

}  // namespace brisvale::ipc
