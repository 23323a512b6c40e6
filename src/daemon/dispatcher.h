// The request dispatcher: decodes a client's message, checks the caller's allowed
// operations, routes the request to its handler and sends the binary reply.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "daemon/matching_context.h"
#include "platform/ipc_service.h"

namespace brisvale {

inline constexpr const char* kEncodedDictionaryKey = "EncodedDictionary";
inline constexpr const char* kAllowedSPIEntitlement = "com.vantrel.private.brisvale.allowedSPI";

// True when a reply was sent; on false the caller cancels the connection.
bool HandleRequest(MatchingContext& context, ipc::Connection* connection,
                   const ipc::Message& message);

// True when the caller's allowed-SPI entitlement lists `name`.
bool CheckAllowedSPI(const ipc::Connection* connection, const char* name);

// "name<pid>" from the caller's executable name and process id, for log lines.
std::optional<std::string> CopyClientName(const ipc::Connection* connection);

}  // namespace brisvale
