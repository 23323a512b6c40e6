// The named-service message transport: a listener on a service name, client
// connections carrying dictionary messages and replies, the peer's identity and
// entitlements, named event streams and keep-alive transactions.
//
// Everything here is delivered on the RunLoop that created it, one event at a time.
// Transport bookkeeping (message ids, reply routing, stream names) never shows in a
// Message's body: handlers see only the dictionary the client sent.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale {
class RunLoop;
}

namespace brisvale::ipc {

// A dictionary message. `replyToken` is the transport's routing information; a reply
// made with CreateReply carries it back so the waiting caller gets the answer.
struct Message {
  plist::Dictionary body;
  std::optional<plist::Integer> replyToken;  // the client's "vexa.id", if it sent one
  bool isReply = false;
};

// The reply to `message`, with an empty body; none when `message` is itself a reply.
inline std::optional<Message> CreateReply(const Message& message) {
  if (message.isReply) return std::nullopt;
  return Message{{}, message.replyToken, true};
}

// What a connection's or listener's handler is told.
enum class EventKind {
  Message,              // a dictionary message arrived
  ConnectionInvalid,    // the peer went away or the connection was cancelled; last event
  ConnectionInterrupted,
};

class Connection {
 public:
  using Handler = std::function<void(EventKind kind, const Message* message)>;
  virtual ~Connection() = default;

  // Starts delivering events to `handler` on the loop. Before Resume nothing is read.
  virtual void Resume(Handler handler) = 0;
  // Queues `message` for the peer; never blocks. False when the connection is gone or
  // its outgoing queue overflowed (the connection is then cancelled).
  virtual bool Send(const Message& message) = 0;
  // Closes the connection; the handler then gets one ConnectionInvalid event.
  virtual void Cancel() = 0;

  // The system's pid_t and uid_t, which are these widths on every platform we build for.
  virtual int32_t PeerPid() const = 0;
  virtual uint32_t PeerUid() const = 0;
  // The caller's executable path; empty when it cannot be found.
  virtual std::string PeerExecutablePath() const = 0;
  // The value of the named entitlement of the caller's executable; none when absent.
  virtual std::optional<plist::Value> CopyEntitlement(std::string_view name) const = 0;
};

class Listener {
 public:
  // A new connection (not yet resumed), or nullptr with ConnectionInvalid when the
  // listener itself has failed.
  using Handler = std::function<void(std::shared_ptr<Connection> connection, EventKind kind)>;
  virtual ~Listener() = default;
  virtual void Resume(Handler handler) = 0;
};

// An event posted on a named stream: {"vexa.stream": stream, "vexa.event": name}.
struct StreamEvent {
  std::optional<std::string> name;
};

class EventStream {
 public:
  virtual ~EventStream() = default;
};

class IpcService {
 public:
  virtual ~IpcService() = default;

  // Listener on the named service; none on failure.
  virtual std::unique_ptr<Listener> CreateListener(std::string_view serviceName) = 0;
  // Delivers the events posted on the named stream while the returned object lives.
  virtual std::unique_ptr<EventStream> RegisterEventStream(
      std::string_view streamName, std::function<void(const StreamEvent& event)> handler) = 0;

  // Keep-alive transactions: a counter the launcher reads; the daemon never exits on idle.
  virtual void BeginTransaction() = 0;
  virtual void EndTransaction() = 0;
  virtual int TransactionCount() const = 0;
};

}  // namespace brisvale::ipc
