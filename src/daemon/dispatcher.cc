#include "daemon/dispatcher.h"

#include <array>
#include <cstdio>
#include <cstring>

#include "base/log.h"
#include "daemon/request_handlers.h"

namespace brisvale {
namespace {

enum class RequestKind { CopyDevices, Mount, Unmount, Sync };

struct Route {
  const char* requestType;
  const char* spiName;  // the entitlement names three of the four differently
  RequestKind kind;
};

constexpr std::array<Route, 4> kRoutes{{
    {"CopyDevices", "CopyDevices", RequestKind::CopyDevices},
    {"Mount", "MountDevice", RequestKind::Mount},
    {"Unmount", "UnmountDevice", RequestKind::Unmount},
    {"Sync", "SyncDevice", RequestKind::Sync},
}};

void RunHandler(RequestKind kind, MatchingContext& context, const plist::Value& request,
                plist::Dictionary& reply) {
  switch (kind) {
    case RequestKind::CopyDevices: HandleCopyDevices(request, reply); break;
    case RequestKind::Mount: HandleMountRequest(context, request, reply); break;
    case RequestKind::Unmount: HandleUnmount(request, reply); break;
    case RequestKind::Sync: HandleSync(request, reply); break;
  }
}

}  // namespace

bool HandleRequest(MatchingContext& context, ipc::Connection* connection,
                   const ipc::Message& message) {
  std::optional<ipc::Message> replyMessage = ipc::CreateReply(message);
  if (!replyMessage) {
    Log(Level::Default, "Failed to create vexa reply dictionary.");
    return false;
  }
  const plist::Value* encoded = message.body.find(kEncodedDictionaryKey);
  const plist::Bytes* bytes = encoded ? encoded->data() : nullptr;
  if (!bytes) {
    Log(Level::Default, "Invalid or missing value for %s.", kEncodedDictionaryKey);
    return false;
  }

  plist::Dictionary reply;
  reply.set("Status", "Failure");

  std::optional<plist::Value> request = plist::Read(*bytes);
  if (!request) {
    Log(Level::Default, "Failed to create dictionary with data.");
    return false;
  }
  // A top level other than a dictionary has no "RequestType" to read.
  const plist::Value* requestType = request->get("RequestType");
  if (!requestType || !requestType->string()) {
    Log(Level::Default, "Invalid value for %@: %@", "RequestType", requestType);
    return false;
  }
  if (log::DebugEnabled()) {
    std::optional<std::string> client = CopyClientName(connection);
    Log(Level::Debug, "Processing VEXA request [%@]: %@", client ? client->c_str() : nullptr,
        *requestType);
  }

  const Route* route = nullptr;
  for (const Route& candidate : kRoutes) {
    if (*requestType->string() == candidate.requestType) {
      route = &candidate;
      break;
    }
  }
  if (!route) {
    Log(Level::Default, "Invalid request type: %@", *requestType);
    return false;
  }
  if (!CheckAllowedSPI(connection, route->spiName)) {
    Log(Level::Default,
        "Missing required entitlement (will be required in <kelpie://problem/25909614>): %@",
        route->spiName);
  }
  RunHandler(route->kind, context, *request, reply);

  replyMessage->body.set(kEncodedDictionaryKey, plist::WriteBinary(plist::Value(std::move(reply))));
  connection->Send(*replyMessage);
  return true;
}

bool CheckAllowedSPI(const ipc::Connection* connection, const char* name) {
  if (!connection || !name) {
    Log(Level::Default, "Invalid inputs.");
    return false;
  }
  std::optional<plist::Value> entitlement = connection->CopyEntitlement(kAllowedSPIEntitlement);
  const plist::Array* allowed = entitlement ? entitlement->array() : nullptr;
  if (!allowed) {
    Log(Level::Default, "Invalid or missing entitlement: %s", kAllowedSPIEntitlement);
    return false;
  }
  for (const plist::Value& element : *allowed) {
    const std::string* text = element.string();
    if (text && *text == name) return true;
  }
  Log(Level::Default, "Invalid or missing entitlement: %@", name);
  return false;
}

std::optional<std::string> CopyClientName(const ipc::Connection* connection) {
  if (!connection) {
    Log(Level::Default, "Invalid input.");
    return std::nullopt;
  }
  // The path and name buffers of the wire-era API were 4096 and 256 bytes with a
  // terminator; keep the same truncation so names in logs match.
  std::string path = connection->PeerExecutablePath();
  if (path.size() > 4095) path.resize(4095);
  size_t slash = path.rfind('/');
  std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (name.size() > 255) name.resize(255);
  char text[512];
  std::snprintf(text, sizeof text, "%s<%d>", name.c_str(), static_cast<int>(connection->PeerPid()));
  return std::string(text);
}

}  // namespace brisvale
