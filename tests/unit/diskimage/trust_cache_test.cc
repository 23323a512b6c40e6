// Trust-cache loading over a fake operating system and a registry holding (or not) the
// code-integrity service: the result and exact line of each way it can end.
#include <gtest/gtest.h>

#include <unistd.h>

#include "base/log.h"
#include "diskimage/trust_cache.h"
#include "fake_os.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using registry::Status;

// Each call answers what its step of the case says.
class CacheOs : public testing::FakeOs {
 public:
  int openResult = 0, sizeResult = 0, mapResult = 0;
  std::vector<uint8_t> contents = {1, 2, 3};

  int OpenFile(const char*) override { return openResult < 0 ? openResult : ::dup(STDIN_FILENO); }
  int FileSize(int, uint64_t& size) override {
    size = contents.size();
    return sizeResult;
  }
  int MapFile(int, size_t length, std::unique_ptr<os::FileMapping>& mapping) override {
    if (mapResult < 0) return mapResult;
    struct Mapping : os::FileMapping {
      std::span<const uint8_t> bytes;
      std::span<const uint8_t> Bytes() const override { return bytes; }
    };
    auto made = std::make_unique<Mapping>();
    made->bytes = std::span(contents).first(length);
    mapping = std::move(made);
    return 0;
  }
};

// Answers each load with the status the case asks for.
struct Loader final : registry::UserClient {
  explicit Loader(Status answer) : answer(answer) {}
  Status CallMethod(uint32_t selector, registry::MethodArgs& args) override {
    return selector == 2 && args.structIn.size() == 3 ? answer : registry::kUnsupported;
  }
  Status answer;
};

TEST(LoadTrustCacheTest, EachWayItEnds) {
  struct Case {
    const char* name;
    int openResult = 0, sizeResult = 0, mapResult = 0;
    bool service = true;
    Status openStatus = registry::kSuccess, callStatus = registry::kSuccess;
    int result = -1;
    std::string line = "";  // "" when none
  } cases[] = {
      {.name = "loaded", .result = 0},
      {.name = "no trust cache", .openResult = -ENOENT, .result = 0, .line = "Failed to open /Developer/.TrustCache: 2"},
      {.name = "unreadable", .openResult = -EACCES, .line = "Failed to open /Developer/.TrustCache: 13"},
      {.name = "fstat fails", .sizeResult = -EIO, .line = "Failed to fstat /Developer/.TrustCache: 5"},
      {.name = "cannot map (empty, a directory)", .mapResult = -EINVAL, .line = "Failed to mmap /Developer/.TrustCache."},
      {.name = "no service", .service = false, .line = "KxServiceGetMatchingService failed."},
      {.name = "open refused", .openStatus = registry::kNotFound, .line = "KxServiceOpen failed: 0x02f0"},
      {.name = "cache refused", .callStatus = registry::kBadArgument, .line = "KxConnectCallMethod failed: 0x02c2"},
  };
  for (const Case& c : cases) {
    CacheOs os;
    os.openResult = c.openResult;
    os.sizeResult = c.sizeResult;
    os.mapResult = c.mapResult;
    registry::RegistryModel registry;
    if (c.service) {
      const auto service = registry.Publish(nullptr, "Ferrovane", {});
      registry.SetUserClientFactory(service, [&, c](uint32_t type) -> registry::Result<std::unique_ptr<registry::UserClient>> {
        if (c.openStatus != registry::kSuccess || type != 0) return {c.openStatus, nullptr};
        return {registry::kSuccess, std::make_unique<Loader>(c.callStatus)};
      });
    }
    ScopedServices services(Services{&registry, &os, nullptr, nullptr});
    log::CaptureSink capture;
    EXPECT_EQ(LoadTrustCache("/Developer"), c.result) << c.name;
    EXPECT_EQ(capture.Texts(), c.line.empty() ? std::vector<std::string>{} : std::vector{c.line}) << c.name;
  }
}

}  // namespace
}  // namespace brisvale
