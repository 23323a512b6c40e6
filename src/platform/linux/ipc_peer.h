// The identity of the process at the other end of a connection: its credentials at
// connect time and a pidfd held for the connection's life, so that a pid the kernel has
// since given to another process is never taken for the caller.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"
#include "base/unique_fd.h"

namespace brisvale::ipc {

inline constexpr char kEntitlementsAttribute[] = "trusted.vexa.entitlements";

class PeerIdentity {
 public:
  PeerIdentity() = default;
  // Reads the credentials of the connected socket `fd`.
  static PeerIdentity FromSocket(int fd);

  pid_t pid() const { return pid_; }
  uid_t uid() const { return uid_; }

  // The peer's executable; empty when the process is gone or the path is unreadable.
  std::string ExecutablePath() const;
  // The entitlements dictionary stored on the peer's executable; none when absent,
  // unreadable or not a dictionary.
  std::optional<plist::Dictionary> Entitlements() const;

 private:
  // True while the process the credentials describe is still running. Checked after
  // every look-up by pid, so that the look-up cannot have reached a successor.
  bool StillRunning() const;

  // What the process ran when it connected: its executable file and its start time.
  struct Image {
    uint64_t device = 0;
    uint64_t inode = 0;
    uint64_t startTime = 0;
    bool operator==(const Image&) const = default;
  };
  static std::optional<Image> ReadImage(pid_t pid);

  pid_t pid_ = 0;
  uid_t uid_ = static_cast<uid_t>(-1);
  UniqueFd pidfd_;
  std::optional<Image> image_;
};

}  // namespace brisvale::ipc
