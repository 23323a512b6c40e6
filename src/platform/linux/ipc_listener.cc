#include "platform/linux/ipc_listener.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <utility>

#include "base/log.h"

namespace brisvale::ipc {
namespace {

constexpr int kAcceptsPerWakeup = 32;
// Descriptors kept for the daemon's own work (mounts, images, the registry, logs)
// whatever the clients hold.
constexpr rlim_t kDescriptorsForOwnWork = 256;
// A connection holds its socket, the loop's duplicate and the peer's pidfd.
constexpr rlim_t kDescriptorsPerConnection = 3;

int OpenReserve() { return ::open("/dev/null", O_RDONLY | O_CLOEXEC); }

// How many connections of users other than root the descriptor limit leaves room for.
size_t UnprivilegedConnectionBudget() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == RLIM_INFINITY) return 4096;
  if (limit.rlim_cur <= kDescriptorsForOwnWork * 2) return 16;
  return static_cast<size_t>((limit.rlim_cur - kDescriptorsForOwnWork) / kDescriptorsPerConnection);
}

ino_t InodeOf(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0 ? status.st_ino : 0;
}

}  // namespace

LinuxListener::LinuxListener(std::shared_ptr<TransportContext> context, UniqueFd socket, std::string ownedPath)
    : context_(std::move(context)), socket_(std::move(socket)), ownedPath_(std::move(ownedPath)) {
  if (!ownedPath_.empty()) ownedInode_ = InodeOf(ownedPath_);
  reserve_.Reset(OpenReserve());
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

void LinuxListener::ShedOneConnection() {
  reserve_.Reset();
  const UniqueFd refused(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  reserve_.Reset(OpenReserve());
}

// Root and the daemon's own user are always served; every other user gets a share of
// the descriptors, one user at most a quarter, so a crowd of idle connections slows
// the others but cannot stop them.
bool LinuxListener::Admit(const LinuxConnection& connection) const {
  const uid_t uid = connection.PeerUid();
  if (uid == 0 || uid == geteuid()) return true;
  const size_t budget = UnprivilegedConnectionBudget();
  const size_t perUser = std::max<size_t>(1, budget / 4);
  const auto found = context_->connectionsByUser.find(uid);
  const size_t mine = found == context_->connectionsByUser.end() ? 0 : found->second;
  if (mine <= perUser && context_->unprivilegedConnections <= budget) return true;
  Log(Level::Default, "Refusing a vexa connection of uid %u: %zu open of %zu for one user, %zu of %zu in all",
      static_cast<unsigned>(uid), mine - 1, perUser, context_->unprivilegedConnections - 1, budget);
  return false;
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
          Log(Level::Default, "Cannot accept a vexa connection: %{errno}d", errno);
          ShedOneConnection();
          continue;
        case ENOBUFS:
        case ENOMEM:
          Log(Level::Default, "Cannot accept a vexa connection: %{errno}d", errno);
          return;
        default:
          Log(Level::Default, "vexa listener failed: %{errno}d", errno);
          source_.Reset();
          if (handler_) handler_(nullptr, EventKind::ConnectionInvalid);
          return;
      }
    }
    auto connection = std::make_shared<LinuxConnection>(context_, UniqueFd(fd));
    if (!Admit(*connection)) continue;
    handler_(std::move(connection), EventKind::Message);
    if (!*alive) return;
  }
}

}  // namespace brisvale::ipc
