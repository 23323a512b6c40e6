#include "platform/linux/ipc_listener.h"

#include <errno.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <utility>

#include "base/log.h"

namespace brisvale::ipc {
namespace {

constexpr int kAcceptsPerWakeup = 32;
// How long accepting pauses when the process is out of descriptors; a level-triggered
// listener would otherwise spin.
constexpr std::chrono::milliseconds kDescriptorExhaustionPause{100};

ino_t InodeOf(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0 ? status.st_ino : 0;
}

}  // namespace

LinuxListener::LinuxListener(std::shared_ptr<TransportContext> context, UniqueFd socket, std::string ownedPath)
    : context_(std::move(context)), socket_(std::move(socket)), ownedPath_(std::move(ownedPath)) {
  if (!ownedPath_.empty()) ownedInode_ = InodeOf(ownedPath_);
}

LinuxListener::~LinuxListener() {
  *alive_ = false;
  if (!ownedPath_.empty() && ownedInode_ != 0 && InodeOf(ownedPath_) == ownedInode_) {
    unlink(ownedPath_.c_str());
  }
}

void LinuxListener::Resume(Handler handler) {
  if (source_) return;
  handler_ = std::move(handler);
  source_ = context_->loop.AddFd(socket_.get(), EPOLLIN, [this](uint32_t) { AcceptReady(); });
  if (!source_) {
    Log(Level::Default, "Cannot watch the vexa listener socket");
    context_->loop.Post([this, alive = alive_] {
      if (*alive && handler_) handler_(nullptr, EventKind::ConnectionInvalid);
    });
  }
}

void LinuxListener::PauseAccepting() {
  context_->loop.ModifyFd(source_, 0);
  resumeTimer_ = context_->loop.AddTimer(kDescriptorExhaustionPause, [this] {
    resumeTimer_.Reset();
    context_->loop.ModifyFd(source_, EPOLLIN);
  });
}

void LinuxListener::AcceptReady() {
  std::shared_ptr<bool> alive = alive_;  // the handler may destroy this listener
  for (int i = 0; i < kAcceptsPerWakeup; ++i) {
    const int fd = accept4(socket_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      switch (errno) {
        case EAGAIN:
          return;
        case EINTR:
        case ECONNABORTED:
        case EPROTO:
          continue;
        case EMFILE:
        case ENFILE:
        case ENOBUFS:
        case ENOMEM:
          Log(Level::Default, "Cannot accept a vexa connection: %{errno}d", errno);
          PauseAccepting();
          return;
        default:
          Log(Level::Default, "vexa listener failed: %{errno}d", errno);
          source_.Reset();
          if (handler_) handler_(nullptr, EventKind::ConnectionInvalid);
          return;
      }
    }
    auto connection = std::make_shared<LinuxConnection>(context_, UniqueFd(fd));
    handler_(std::move(connection), EventKind::Message);
    if (!*alive) return;
  }
}

}  // namespace brisvale::ipc
