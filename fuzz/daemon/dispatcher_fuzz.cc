// Arbitrary bytes from a client, through the transport's frame reader, into the
// request dispatcher. The platform behind it is fake: an empty registry and an
// operating system whose calls all fail.
#include <cstdint>
#include <vector>

#include "base/log.h"
#include "daemon/dispatcher.h"
#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_message.h"
#include "fake_os.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace {

using namespace brisvale;

class NullSink : public log::Sink {
 public:
  void Write(log::Level, std::string_view) override {}
};

class RecordingConnection : public ipc::Connection {
 public:
  void Resume(Handler) override {}
  bool Send(const ipc::Message&) override { return true; }
  void Cancel() override {}
  pid_t PeerPid() const override { return 4242; }
  uid_t PeerUid() const override { return 501; }
  std::string PeerExecutablePath() const override { return "/usr/bin/fuzzclient"; }
  std::optional<plist::Value> CopyEntitlement(std::string_view) const override {
    return std::nullopt;
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static NullSink sink;
  static bool initialised = [] {
    log::SetSink(&sink);
    log::SetDebugEnabled(true);  // format the debug lines too
    return true;
  }();
  (void)initialised;

  static registry::RegistryModel registry;
  static testing::FakeOs os;  // an empty mount table; every other call refused
  ScopedServices services(Services{&registry, &os, nullptr});

  ipc::FrameReader reader;
  std::vector<plist::Dictionary> frames;
  // Fed in two pieces so frames split across reads are exercised as well.
  size_t half = size / 2;
  reader.Feed({data, half}, frames);
  reader.Feed({data + half, size - half}, frames);

  RecordingConnection connection;
  MatchingContext context;
  for (plist::Dictionary& frame : frames) {
    std::string error;
    std::optional<ipc::Message> message = ipc::MessageFromFrame(std::move(frame), &error);
    if (message) HandleRequest(context, &connection, *message);
  }
  return 0;
}
