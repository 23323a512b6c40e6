#include "platform/linux/ipc_client.h"

#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>

#include <array>
#include <utility>
#include <vector>

#include "platform/linux/ipc_message.h"
#include "platform/linux/ipc_socket.h"

namespace brisvale::ipc {
namespace {

using Clock = std::chrono::steady_clock;

int RemainingMs(Clock::time_point deadline) {
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left <= 0 ? 0 : static_cast<int>(std::min<long long>(left, 1 << 30));
}

std::string MillisecondsText(std::chrono::milliseconds duration) { return std::to_string(duration.count()) + " ms"; }

}  // namespace

const char* ClientStatusName(ClientStatus status) {
  switch (status) {
    case ClientStatus::Ok:
      return "ok";
    case ClientStatus::NotRunning:
      return "not running";
    case ClientStatus::Cancelled:
      return "cancelled";
    case ClientStatus::TimedOut:
      return "timed out";
    case ClientStatus::Failed:
      return "failed";
  }
  return "failed";
}

std::optional<Client> Client::Connect(std::string_view path, ClientReply* failure) {
  std::string error;
  UniqueFd socket = ConnectToPath(path, &error);
  if (!socket) {
    if (failure) {
      failure->status = ClientStatus::NotRunning;
      failure->error = "the service is not running (" + error + ")";
    }
    return std::nullopt;
  }
  return Client(std::move(socket), std::string(path));
}

ClientReply Client::Failure(ClientStatus status, std::string error) {
  ClientReply reply;
  reply.status = status;
  reply.error = std::move(error);
  return reply;
}

std::optional<int64_t> Client::Send(const plist::Dictionary& body, ClientReply* failure,
                                    std::chrono::milliseconds timeout) {
  Message message;
  message.body = body;
  const int64_t id = nextId_++;
  message.replyToken = plist::Integer{id, false};
  std::optional<plist::Bytes> frame = EncodeFrame(FrameFromMessage(message));
  if (!frame) {
    if (failure) *failure = Failure(ClientStatus::Failed, "the request is larger than 4 MiB");
    return std::nullopt;
  }
  const Clock::time_point deadline = Clock::now() + timeout;
  size_t written = 0;
  while (written < frame->size()) {
    const ssize_t count = send(socket_.get(), frame->data() + written, frame->size() - written,
                               MSG_DONTWAIT | MSG_NOSIGNAL);
    if (count >= 0) {
      written += static_cast<size_t>(count);
      continue;
    }
    if (errno == EINTR) continue;
    if (errno != EAGAIN) {
      if (failure) {
        *failure = Failure(errno == EPIPE || errno == ECONNRESET ? ClientStatus::Cancelled : ClientStatus::Failed,
                           "sending to " + path_ + " failed: " + strerror(errno));
      }
      return std::nullopt;
    }
    pollfd entry{socket_.get(), POLLOUT, 0};
    if (poll(&entry, 1, RemainingMs(deadline)) == 0) {
      if (failure) {
        *failure = Failure(ClientStatus::TimedOut,
                           "the service did not take the request within " + MillisecondsText(timeout));
      }
      return std::nullopt;
    }
  }
  return id;
}

ClientReply Client::WaitForReply(int64_t id, std::chrono::milliseconds timeout) {
  const Clock::time_point deadline = Clock::now() + timeout;
  std::array<uint8_t, 64 * 1024> buffer;
  for (;;) {
    for (auto it = received_.begin(); it != received_.end(); ++it) {
      std::string error;
      std::optional<Message> message = MessageFromFrame(*it, &error);
      if (message && message->isReply && message->replyToken && message->replyToken->value == id) {
        ClientReply reply;
        reply.status = ClientStatus::Ok;
        reply.body = std::move(message->body);
        received_.erase(it);
        return reply;
      }
    }
    if (reader_.Failed()) {
      return Failure(ClientStatus::Failed, "the service sent a malformed reply");
    }

    pollfd entry{socket_.get(), POLLIN, 0};
    const int ready = poll(&entry, 1, RemainingMs(deadline));
    if (ready < 0 && errno == EINTR) continue;
    if (ready == 0) {
      return Failure(ClientStatus::TimedOut, "no reply from " + path_ + " within " + MillisecondsText(timeout));
    }
    const ssize_t count = recv(socket_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
    if (count < 0) {
      if (errno == EINTR || errno == EAGAIN) continue;
      if (errno == ECONNRESET) {
        return Failure(ClientStatus::Cancelled, "the service closed the connection without replying");
      }
      return Failure(ClientStatus::Failed, std::string("reading from the service failed: ") + strerror(errno));
    }
    if (count == 0) {
      return Failure(ClientStatus::Cancelled, "the service closed the connection without replying");
    }
    std::vector<plist::Dictionary> frames;
    std::optional<FrameReader::Failure> failure =
        reader_.Feed(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(count)), frames);
    for (plist::Dictionary& frame : frames) received_.push_back(std::move(frame));
    if (failure && frames.empty()) {
      return Failure(ClientStatus::Failed,
                     std::string("the service sent a malformed reply: ") + FrameErrorText(failure->error));
    }
  }
}

ClientReply Client::Request(const plist::Dictionary& body, std::chrono::milliseconds timeout) {
  const Clock::time_point deadline = Clock::now() + timeout;
  ClientReply failure;
  std::optional<int64_t> id = Send(body, &failure, timeout);
  if (!id) return failure;
  return WaitForReply(*id, std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()));
}

ClientReply PostEvent(std::string_view eventsPath, std::string_view stream, std::string_view name,
                      std::chrono::milliseconds timeout) {
  ClientReply failure;
  std::optional<Client> client = Client::Connect(eventsPath, &failure);
  if (!client) return failure;
  plist::Dictionary body{{"vexa.stream", plist::Value(stream)}, {"vexa.event", plist::Value(name)}};
  ClientReply reply = client->Request(body, timeout);
  if (reply.status == ClientStatus::Cancelled) {
    reply.error = "the service refused the event (posting events needs root)";
  }
  return reply;
}

}  // namespace brisvale::ipc
