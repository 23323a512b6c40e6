#include "platform/linux/ipc_connection.h"

#include <malloc.h>

#include <errno.h>
#include <string.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <array>
#include <utility>
#include <vector>

#include "base/log.h"
#include "platform/linux/ipc_message.h"

namespace brisvale::ipc {
namespace {

constexpr size_t kReadChunk = 64 * 1024;
// Chunks read per wake-up, so that one busy peer cannot starve the others.
constexpr int kReadsPerWakeup = 4;
// Giving memory back to the system costs a walk of the heap: only after a large buffer.
constexpr size_t kTrimThreshold = 1 << 20;

}  // namespace

void TransportContext::Shutdown() {
  shutDown = true;
  std::set<std::shared_ptr<LinuxConnection>> connections = std::move(live);
  live.clear();
  for (const auto& connection : connections) connection->Shutdown();
}

LinuxConnection::LinuxConnection(std::shared_ptr<TransportContext> context, UniqueFd socket)
    : context_(std::move(context)), socket_(std::move(socket)), peer_(PeerIdentity::FromSocket(socket_.get())) {
  if (peer_.uid() != 0) {
    ++context_->connectionsByUser[peer_.uid()];
    ++context_->unprivilegedConnections;
  }
}

LinuxConnection::~LinuxConnection() {
  ReleaseBuffers();
  if (peer_.uid() == 0) return;
  if (--context_->connectionsByUser[peer_.uid()] == 0) context_->connectionsByUser.erase(peer_.uid());
  --context_->unprivilegedConnections;
}

void LinuxConnection::Resume(Handler handler) {
  if (state_ == State::Resumed) return;
  handler_ = std::move(handler);
  if (state_ == State::Closed) {
    // Cancelled before it was resumed: the handler still gets its one last event.
    context_->loop.Post([self = shared_from_this()] { self->DeliverInvalid(); });
    return;
  }
  state_ = State::Resumed;
  if (!context_->shutDown) context_->live.insert(shared_from_this());
  UpdateInterest();
}

std::optional<plist::Value> LinuxConnection::CopyEntitlement(std::string_view name) const {
  std::optional<plist::Dictionary> entitlements = peer_.Entitlements();
  if (!entitlements) return std::nullopt;
  const plist::Value* value = entitlements->find(name);
  if (!value) return std::nullopt;
  return *value;
}

bool LinuxConnection::Send(const Message& message) {
  if (state_ == State::Closed) return false;
  std::optional<plist::Bytes> frame = EncodeFrame(FrameFromMessage(message));
  if (!frame) {
    Close("message larger than 4 MiB");
    return false;
  }
  if (queuedBytes_ + frame->size() > context_->outgoingQueueLimit) {
    Close("outgoing queue full (" + std::to_string(queuedBytes_) + " bytes unread)");
    return false;
  }
  queuedBytes_ += frame->size();
  outgoing_.push_back(std::move(*frame));
  if (outgoing_.size() == 1 && !WriteQueued()) return false;
  if (!AccountBuffers()) return false;
  UpdateInterest();
  return true;
}

void LinuxConnection::Cancel() { Close(); }

void LinuxConnection::Shutdown() {
  handler_ = nullptr;
  invalidDelivered_ = true;
  state_ = State::Closed;
  source_.Reset();
  partialFrameTimer_.Reset();
  socket_.Reset();
  outgoing_.clear();
  queuedBytes_ = 0;
}

void LinuxConnection::UpdateInterest() {
  uint32_t wanted = 0;
  if (state_ == State::Resumed) wanted |= EPOLLIN;
  if (state_ != State::Closed && !outgoing_.empty()) wanted |= EPOLLOUT;
  if (wanted == interest_ && (source_ || wanted == 0)) return;
  interest_ = wanted;
  if (!source_) {
    if (wanted == 0) return;
    source_ = context_->loop.WatchFd(socket_.get(), wanted, [this](uint32_t events) { OnReady(events); });
  } else {
    context_->loop.ModifyFd(source_, wanted);
  }
}

void LinuxConnection::OnReady(uint32_t events) {
  auto self = shared_from_this();  // the handler may drop the last outside reference
  if ((events & EPOLLOUT) && !WriteQueued()) return;
  if (state_ == State::Resumed && (events & (EPOLLIN | EPOLLHUP | EPOLLERR))) {
    ReadAvailable();
  } else if (state_ != State::Resumed && (events & (EPOLLHUP | EPOLLERR))) {
    Close();
  }
  if (state_ != State::Closed) UpdateInterest();
}

void LinuxConnection::ReadAvailable() {
  std::array<uint8_t, kReadChunk> buffer;
  std::vector<plist::Dictionary> frames;
  bool peerClosed = false;
  for (int round = 0; round < kReadsPerWakeup && state_ == State::Resumed; ++round) {
    const ssize_t count = recv(socket_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
    if (count < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN) break;
      Close(std::string("read failed: ") + strerror(errno));
      return;
    }
    if (count == 0) {
      peerClosed = true;
      break;
    }
    lastProgress_ = RunLoop::Clock::now();
    frames.clear();
    std::optional<FrameReader::Failure> failure =
        reader_.Feed(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(count)), frames);
    for (plist::Dictionary& frame : frames) {
      if (state_ != State::Resumed) return;
      std::string error;
      std::optional<Message> message = MessageFromFrame(std::move(frame), &error);
      if (!message) {
        Close(error);
        return;
      }
      handler_(EventKind::Message, &*message);
    }
    if (failure) {
      Close(failure->detail.empty() ? FrameErrorText(failure->error)
                                    : std::string(FrameErrorText(failure->error)) + ": " + failure->detail);
      return;
    }
    if (static_cast<size_t>(count) < buffer.size()) break;
  }
  if (state_ != State::Resumed || !AccountBuffers()) return;
  if (peerClosed) {
    if (reader_.HasPartialFrame()) {
      Log(Level::Debug, "vexa peer %d closed its connection in the middle of a frame", static_cast<int>(PeerPid()));
    }
    Close();
    return;
  }
  UpdatePartialFrameTimer();
}

bool LinuxConnection::WriteQueued() {
  while (!outgoing_.empty()) {
    const plist::Bytes& front = outgoing_.front();
    const ssize_t count = send(socket_.get(), front.data() + outgoingOffset_, front.size() - outgoingOffset_,
                               MSG_DONTWAIT | MSG_NOSIGNAL);
    if (count < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN) return true;
      // The peer is gone; reading will tell the same story, without a log line.
      Close();
      return false;
    }
    outgoingOffset_ += static_cast<size_t>(count);
    queuedBytes_ -= static_cast<size_t>(count);
    if (outgoingOffset_ == front.size()) {
      outgoing_.pop_front();
      outgoingOffset_ = 0;
    }
  }
  return state_ == State::Closed || AccountBuffers();
}

void LinuxConnection::UpdatePartialFrameTimer() {
  if (!reader_.HasPartialFrame()) {
    partialFrameTimer_.Reset();
    return;
  }
  // One timer per stall rather than one per read: when it fires it checks how long
  // the peer has really been silent.
  if (!partialFrameTimer_) {
    partialFrameTimer_ = context_->loop.AddTimer(context_->partialFrameTimeout, [this] { OnPartialFrameTimer(); });
  }
}

void LinuxConnection::OnPartialFrameTimer() {
  auto self = shared_from_this();
  partialFrameTimer_.Reset();
  if (state_ != State::Resumed || !reader_.HasPartialFrame()) return;
  const auto silence =
      std::chrono::duration_cast<std::chrono::milliseconds>(RunLoop::Clock::now() - lastProgress_);
  if (silence >= context_->partialFrameTimeout) {
    Close("incomplete frame, then silence for " + std::to_string(silence.count()) + " ms");
    return;
  }
  partialFrameTimer_ =
      context_->loop.AddTimer(context_->partialFrameTimeout - silence, [this] { OnPartialFrameTimer(); });
}

void LinuxConnection::Close(const std::string& reason) {
  if (state_ == State::Closed) return;
  if (!reason.empty()) {
    Log(Level::Default, "Cancelling vexa connection of pid %d: %s", static_cast<int>(PeerPid()), reason);
  }
  state_ = State::Closed;
  source_.Reset();
  partialFrameTimer_.Reset();
  // Replies already queued get one last chance to leave, without waiting.
  WriteQueued();
  outgoing_.clear();
  queuedBytes_ = 0;
  reader_ = FrameReader();
  ReleaseBuffers();
  socket_.Reset();
  context_->loop.Post([self = shared_from_this()] { self->DeliverInvalid(); });
}

bool LinuxConnection::AccountBuffers() {
  const size_t now = reader_.BufferedBytes() + queuedBytes_;
  const size_t before = accountedBytes_;
  context_->bufferedBytes = context_->bufferedBytes - before + now;
  accountedBytes_ = now;
  if (now > before && context_->bufferedBytes > context_->bufferBudget) {
    Close("buffered bytes over the budget of all connections (" + std::to_string(context_->bufferedBytes) +
          " of " + std::to_string(context_->bufferBudget) + ")");
    return false;
  }
  if (before >= now + kTrimThreshold) malloc_trim(0);
  return true;
}

void LinuxConnection::ReleaseBuffers() {
  context_->bufferedBytes -= accountedBytes_;
  // Large frames come from the heap's top or its own mappings: give them back.
  if (accountedBytes_ >= kTrimThreshold) malloc_trim(0);
  accountedBytes_ = 0;
}

void LinuxConnection::DeliverInvalid() {
  if (invalidDelivered_ || !handler_) return;
  invalidDelivered_ = true;
  Handler handler = std::move(handler_);
  handler_ = nullptr;
  handler(EventKind::ConnectionInvalid, nullptr);
  context_->live.erase(shared_from_this());
}

}  // namespace brisvale::ipc
