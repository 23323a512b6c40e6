// The client side of the message transport, for tools and tests: a blocking connection
// to a service socket that sends dictionary requests and waits for their replies, and
// the one-shot posting of a stream event. Needs no RunLoop.
#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"
#include "base/unique_fd.h"
#include "platform/linux/ipc_frame.h"

namespace brisvale::ipc {

enum class ClientStatus {
  Ok,
  NotRunning,  // nothing accepts connections on the socket path
  Cancelled,   // the service closed the connection before replying
  TimedOut,    // no reply within the time allowed
  Failed,      // the connection broke or the service sent something unreadable
};

struct ClientReply {
  ClientStatus status = ClientStatus::Failed;
  plist::Dictionary body;  // the reply, without transport keys, when status is Ok
  std::string error;       // what went wrong, for people, when status is not Ok
  bool ok() const { return status == ClientStatus::Ok; }
};

class Client {
 public:
  // Connects to the service socket at `path`; on failure the reply says why (NotRunning).
  static std::optional<Client> Connect(std::string_view path, ClientReply* failure = nullptr);

  // Sends `body` with a fresh "vexa.id" and returns that id; none when the connection
  // is broken or the service does not take the bytes within `timeout` (`failure` says why).
  std::optional<int64_t> Send(const plist::Dictionary& body, ClientReply* failure = nullptr,
                              std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Waits for the reply carrying `id` under "vexa.reply-to"; messages for other ids
  // are skipped.
  ClientReply WaitForReply(int64_t id, std::chrono::milliseconds timeout);
  // Send, then WaitForReply.
  ClientReply Request(const plist::Dictionary& body, std::chrono::milliseconds timeout);

  int fd() const { return socket_.get(); }

 private:
  Client(UniqueFd socket, std::string path) : socket_(std::move(socket)), path_(std::move(path)) {}
  ClientReply Failure(ClientStatus status, std::string error);

  UniqueFd socket_;
  std::string path_;
  FrameReader reader_;
  std::deque<plist::Dictionary> received_;  // frames read while waiting for another id
  int64_t nextId_ = 1;
};

// Posts {"vexa.stream": stream, "vexa.event": name} on the events socket and waits
// until the service has handled it.
ClientReply PostEvent(std::string_view eventsPath, std::string_view stream, std::string_view name,
                      std::chrono::milliseconds timeout = std::chrono::seconds(10));

const char* ClientStatusName(ClientStatus status);

}  // namespace brisvale::ipc
