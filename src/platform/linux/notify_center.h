// The Linux notification centre, without a daemon of its own: every subscriber binds a
// datagram socket in one directory; a post sends one binary property list
// {"Name", "Object", "UserInfo", "Distributed"} to each socket there.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "base/unique_fd.h"
#include "platform/system_notify.h"

namespace brisvale::notify {

inline constexpr const char* kDefaultNotifyDirectory = "/var/run/vexa/notify";

// Posts to the subscribers in `directory`, which it creates (mode 0755) when missing.
std::unique_ptr<SystemNotify> CreateLinuxSystemNotify(std::string directory = kDefaultNotifyDirectory);

// The wire form of a notification, and back; none for bytes that are not one.
plist::Bytes EncodeNotification(const Notification& notification);
std::optional<Notification> DecodeNotification(std::span<const uint8_t> bytes);

// One subscriber socket, removed again when the subscriber goes.
class Subscriber {
 public:
  // Binds a socket with a name of its own in `directory`; nullptr with `error` set on
  // failure.
  static std::unique_ptr<Subscriber> Create(const std::string& directory, std::string* error);
  ~Subscriber();
  Subscriber(const Subscriber&) = delete;
  Subscriber& operator=(const Subscriber&) = delete;

  // The next notification; none when `timeout` passes first (forever when absent).
  std::optional<Notification> Receive(std::optional<std::chrono::milliseconds> timeout);
  int fd() const { return socket_.get(); }

 private:
  Subscriber() = default;
  UniqueFd socket_;
  std::string path_;
};

}  // namespace brisvale::notify
