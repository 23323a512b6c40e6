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

class Loader final : public registry::UserClient {
 public:
  Loader(Status answer, std::vector<uint8_t>& received) : answer_(answer), received_(received) {}
  Status CallMethod(uint32_t selector, registry::MethodArgs& args) override {
    if (selector != 2) return registry::kUnsupported;
    received_.assign(args.structIn.begin(), args.structIn.end());
    return answer_;
  }

 private:
  Status answer_;
  std::vector<uint8_t>& received_;
};

TEST(LoadTrustCacheTest, EachWayItEnds) {
  struct Case {
    const char* name;
    int openResult, sizeResult, mapResult;
    bool service;
    Status openStatus, callStatus;
    int result;
    std::string line;  // "" when none
  } cases[] = {
      {"loaded", 0, 0, 0, true, registry::kSuccess, registry::kSuccess, 0, ""},
      {"no trust cache", -ENOENT, 0, 0, true, registry::kSuccess, registry::kSuccess, 0,
       "Failed to open /Developer/.TrustCache: 2"},
      {"unreadable", -EACCES, 0, 0, true, registry::kSuccess, registry::kSuccess, -1,
       "Failed to open /Developer/.TrustCache: 13"},
      {"fstat fails", 0, -EIO, 0, true, registry::kSuccess, registry::kSuccess, -1,
       "Failed to fstat /Developer/.TrustCache: 5"},
      {"cannot map (empty, a directory)", 0, 0, -EINVAL, true, registry::kSuccess, registry::kSuccess, -1,
       "Failed to mmap /Developer/.TrustCache."},
      {"no service", 0, 0, 0, false, registry::kSuccess, registry::kSuccess, -1,
       "KxServiceGetMatchingService failed."},
      {"open refused", 0, 0, 0, true, registry::kNotFound, registry::kSuccess, -1,
       "KxServiceOpen failed: 0x02f0"},
      {"cache refused", 0, 0, 0, true, registry::kSuccess, registry::kBadArgument, -1,
       "KxConnectCallMethod failed: 0x02c2"},
  };
  for (const Case& c : cases) {
    CacheOs os;
    os.openResult = c.openResult;
    os.sizeResult = c.sizeResult;
    os.mapResult = c.mapResult;
    registry::RegistryModel registry;
    std::vector<uint8_t> received;
    if (c.service) {
      const auto service = registry.Publish(nullptr, "Ferrovane", {});
      registry.SetUserClientFactory(service, [&, c](uint32_t type) -> registry::Result<std::unique_ptr<registry::UserClient>> {
        if (c.openStatus != registry::kSuccess || type != 0) return {c.openStatus, nullptr};
        return {registry::kSuccess, std::make_unique<Loader>(c.callStatus, received)};
      });
    }
    ScopedServices services(Services{&registry, &os, nullptr, nullptr});
    log::CaptureSink capture;
    EXPECT_EQ(LoadTrustCache("/Developer"), c.result) << c.name;
    EXPECT_EQ(capture.Texts(), c.line.empty() ? std::vector<std::string>{} : std::vector{c.line}) << c.name;
    if (c.result == 0 && c.openResult == 0) {
      EXPECT_EQ(received, os.contents) << c.name;  // handed over unchanged
    }
  }
}

}  // namespace
}  // namespace brisvale
