// A connection without a socket: records what the daemon sends and cancels.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/ipc_service.h"

namespace brisvale::testing {

class FakeConnection : public ipc::Connection {
 public:
  std::string executablePath = "/usr/libexec/imgclient";
  pid_t pid = 412;
  std::optional<plist::Value> allowedSPI;
  std::vector<ipc::Message> sent;
  bool cancelled = false;
  Handler handler;

  void Resume(Handler h) override { handler = std::move(h); }
  bool Send(const ipc::Message& message) override {
    sent.push_back(message);
    return true;
  }
  void Cancel() override { cancelled = true; }
  pid_t PeerPid() const override { return pid; }
  uid_t PeerUid() const override { return 0; }
  std::string PeerExecutablePath() const override { return executablePath; }
  std::optional<plist::Value> CopyEntitlement(std::string_view name) const override {
    if (name == "com.vantrel.private.brisvale.allowedSPI") return allowedSPI;
    return std::nullopt;
  }
};

}  // namespace brisvale::testing
