// One client connection of the Linux transport: reads frames from its socket on the
// loop, hands each message to the handler in order, and writes what is sent through a
// bounded outgoing queue so that a peer that does not read can never stall the loop.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <map>
#include <set>
#include <string>

#include "base/runloop.h"
#include "platform/ipc_service.h"
#include "base/unique_fd.h"
#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_peer.h"

namespace brisvale::ipc {

class LinuxConnection;

// What every connection of one service shares. A resumed connection stays alive here,
// whether or not its handler keeps a reference, until its ConnectionInvalid event has
// been delivered, or until the service goes and Shutdown closes them all.
struct TransportContext {
  TransportContext(RunLoop& loop, std::chrono::milliseconds partialFrameTimeout,
                   size_t outgoingQueueLimit)
      : loop(loop), partialFrameTimeout(partialFrameTimeout), outgoingQueueLimit(outgoingQueueLimit) {}

  // Closes every live connection without telling its handler (the service is going).
  void Shutdown();

  RunLoop& loop;
  const std::chrono::milliseconds partialFrameTimeout;
  const size_t outgoingQueueLimit;
  std::set<std::shared_ptr<LinuxConnection>> live;
  bool shutDown = false;
  // Open connections of users other than root, counted from accept to close.
  std::map<uid_t, size_t> connectionsByUser;
  size_t unprivilegedConnections = 0;
  // Bytes all connections hold in incomplete frames and unsent replies, and the most
  // they may hold together: a connection that takes more is cancelled.
  size_t bufferedBytes = 0;
  size_t bufferBudget = 32u << 20;
};

class LinuxConnection : public Connection, public std::enable_shared_from_this<LinuxConnection> {
 public:
  LinuxConnection(std::shared_ptr<TransportContext> context, UniqueFd socket);
  ~LinuxConnection() override;

  void Resume(Handler handler) override;
  bool Send(const Message& message) override;
  void Cancel() override;

  pid_t PeerPid() const override { return peer_.pid(); }
  uid_t PeerUid() const override { return peer_.uid(); }
  std::string PeerExecutablePath() const override { return peer_.ExecutablePath(); }
  std::optional<plist::Value> CopyEntitlement(std::string_view name) const override;

  // Closes the socket and forgets the handler without calling it.
  void Shutdown();

 private:
  enum class State { Suspended, Resumed, Closed };

  void OnReady(uint32_t events);
  void ReadAvailable();
  bool WriteQueued();  // false when the connection had to be closed
  void UpdateInterest();
  void UpdatePartialFrameTimer();
  void OnPartialFrameTimer();
  // Closes the socket and queues the one ConnectionInvalid event. `reason` is logged
  // when the transport itself ended the connection.
  void Close(const std::string& reason = {});
  // Brings this connection's share of the buffered bytes up to date; cancels it and
  // answers false when it grew past what all connections may hold together.
  bool AccountBuffers();
  void ReleaseBuffers();
  void DeliverInvalid();

  std::shared_ptr<TransportContext> context_;
  UniqueFd socket_;
  PeerIdentity peer_;
  State state_ = State::Suspended;
  Handler handler_;
  bool invalidDelivered_ = false;
  SourceHandle source_;
  uint32_t interest_ = 0;

  FrameReader reader_;
  SourceHandle partialFrameTimer_;
  RunLoop::Clock::time_point lastProgress_{};

  std::deque<plist::Bytes> outgoing_;
  size_t outgoingOffset_ = 0;  // bytes of outgoing_.front() already written
  size_t queuedBytes_ = 0;
  size_t accountedBytes_ = 0;  // this connection's part of context_->bufferedBytes
};

}  // namespace brisvale::ipc
