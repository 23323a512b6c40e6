#include "platform/linux/notify_center.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <vector>

namespace brisvale::notify {
namespace {

constexpr size_t kMaxNotificationBytes = 64 * 1024;
constexpr const char* kSubscriberPrefix = "sub-";

std::optional<sockaddr_un> Address(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return std::nullopt;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  return address;
}

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};

class LinuxSystemNotify final : public SystemNotify {
 public:
  explicit LinuxSystemNotify(std::string directory) : directory_(std::move(directory)) {
    std::error_code ignored;
    if (std::filesystem::create_directories(directory_, ignored)) ::chmod(directory_.c_str(), 0755);
    socket_.Reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  }

  void Post(const Notification& notification) override {
    if (!socket_) return;
    const plist::Bytes bytes = EncodeNotification(notification);
    // Every socket in the directory is a subscriber, whatever its name. Read with plain
    // calls: nothing here may throw, as a throwing directory iterator would.
    const std::unique_ptr<DIR, DirCloser> dir(::opendir(directory_.c_str()));
    if (!dir) return;
    const int dirFd = ::dirfd(dir.get());
    while (const dirent* entry = ::readdir(dir.get())) {
      if (entry->d_type != DT_SOCK && entry->d_type != DT_UNKNOWN) continue;
      struct stat status {};
      if (::fstatat(dirFd, entry->d_name, &status, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISSOCK(status.st_mode)) continue;
      const std::optional<sockaddr_un> address = Address(directory_ + "/" + entry->d_name);
      if (!address) continue;
      const ssize_t sent = ::sendto(socket_.get(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL,
                                    reinterpret_cast<const sockaddr*>(&*address), sizeof *address);
      // Nobody is bound there any more: the subscriber died without cleaning up. A full
      // queue (EAGAIN) only costs that subscriber this one notification, and a stream
      // socket (EPROTOTYPE) is no subscriber.
      if (sent < 0 && errno == ECONNREFUSED) ::unlinkat(dirFd, entry->d_name, 0);
    }
  }

 private:
  std::string directory_;
  UniqueFd socket_;
};

}  // namespace

std::unique_ptr<SystemNotify> CreateLinuxSystemNotify(std::string directory) {
  return std::make_unique<LinuxSystemNotify>(std::move(directory));
}

plist::Bytes EncodeNotification(const Notification& notification) {
  plist::Dictionary message{{"Name", plist::Value(notification.name)},
                            {"Object", notification.object},
                            {"Distributed", plist::Value::Bool(notification.distributed)}};
  if (notification.userInfo) message.set("UserInfo", plist::Value(*notification.userInfo));
  return plist::WriteBinary(plist::Value(std::move(message)));
}

std::optional<Notification> DecodeNotification(std::span<const uint8_t> bytes) {
  const std::optional<plist::Value> message = plist::ReadBinary(bytes);
  if (!message || !message->getString("Name")) return std::nullopt;
  Notification notification;
  notification.name = *message->getString("Name");
  if (const plist::Value* object = message->get("Object")) notification.object = *object;
  if (const plist::Value* info = message->get("UserInfo"); info && info->dictionary()) {
    notification.userInfo = *info->dictionary();
  }
  if (const plist::Value* distributed = message->get("Distributed")) {
    notification.distributed = distributed->boolean().value_or(false);
  }
  return notification;
}

std::unique_ptr<Subscriber> Subscriber::Create(const std::string& directory, std::string* error) {
  static std::atomic<unsigned> counter{0};
  std::unique_ptr<Subscriber> subscriber(new Subscriber);
  subscriber->socket_.Reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!subscriber->socket_) {
    if (error) *error = std::string("socket: ") + std::strerror(errno);
    return nullptr;
  }
  const std::string path = directory + "/" + kSubscriberPrefix + std::to_string(::getpid()) + "-" +
                           std::to_string(counter++);
  const std::optional<sockaddr_un> address = Address(path);
  if (!address) {
    if (error) *error = "socket path too long: " + path;
    return nullptr;
  }
  ::unlink(path.c_str());  // a name left by a process whose pid this one now has
  if (::bind(subscriber->socket_.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof *address) != 0) {
    if (error) *error = "cannot listen at " + path + ": " + std::strerror(errno);
    return nullptr;
  }
  subscriber->path_ = path;
  return subscriber;
}

Subscriber::~Subscriber() {
  if (!path_.empty()) ::unlink(path_.c_str());
}

std::optional<Notification> Subscriber::Receive(std::optional<std::chrono::milliseconds> timeout) {
  std::vector<uint8_t> buffer(kMaxNotificationBytes);
  for (;;) {
    pollfd ready{socket_.get(), POLLIN, 0};
    const int polled = ::poll(&ready, 1, timeout ? static_cast<int>(timeout->count()) : -1);
    if (polled < 0 && errno == EINTR) continue;
    if (polled <= 0) return std::nullopt;
    const ssize_t received = ::recv(socket_.get(), buffer.data(), buffer.size(), 0);
    if (received < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    // Anyone may write to the socket: what does not decode is dropped.
    if (auto notification = DecodeNotification({buffer.data(), static_cast<size_t>(received)})) {
      return notification;
    }
  }
}

}  // namespace brisvale::notify
