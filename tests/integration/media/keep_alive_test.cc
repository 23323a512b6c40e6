// The keep-alive count the running daemon exports for the launcher: every hardware event
// renews a subscription, which holds one transaction for the keep-alive interval.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <fstream>
#include <thread>

#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

// How long after `start` the exported count first equals `expected`; none within `limit`.
std::optional<Clock::duration> TimeUntilCount(const SandboxDaemon& daemon, int32_t expected,
                                              Clock::time_point start, Clock::duration limit) {
  for (;;) {
    std::ifstream file(daemon.Path("/private/var/run/vexa/brisvale-mounterd.transactions"), std::ios::binary);
    int32_t count = -1;
    if (file.read(reinterpret_cast<char*>(&count), sizeof count) && count == expected) return Clock::now() - start;
    if (Clock::now() - start > limit) return std::nullopt;
    std::this_thread::sleep_for(5ms);
  }
}

TEST(KeepAliveTest, EachHardwareEventHoldsOneTransactionForTheInterval) {
  BRISVALE_REQUIRE_ROOT();
  constexpr auto kInterval = 1500ms;
  SandboxDaemon daemon;
  ASSERT_TRUE(daemon.Start({"--test-keep-alive-ms", "1500"}));
  // The subscriptions made at start-up hold theirs first.
  ASSERT_TRUE(TimeUntilCount(daemon, 0, Clock::now(), 10s));

  const Clock::time_point posted = Clock::now();
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.mobile.ptp_camera").ok());
  ASSERT_TRUE(TimeUntilCount(daemon, 2, posted, kInterval)) << "the count never reached 2";
  const auto fell = TimeUntilCount(daemon, 0, posted, 10 * kInterval);
  ASSERT_TRUE(fell) << "the count never fell back";
  EXPECT_GE(*fell, kInterval - 100ms) << "released before its interval";
}

}  // namespace
}  // namespace brisvale::testing
