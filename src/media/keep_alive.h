// Keep-alive transactions: while one is open the launcher will not consider the daemon
// idle. Handlers hold one for as long as they run; subscriptions hold one for a while
// longer so that media arriving right after a hardware event still find the process up.
#pragma once

#include <chrono>

namespace brisvale {

class BackgroundQueue;

// Holds one transaction for its own lifetime.
class ScopedKeepAlive {
 public:
  ScopedKeepAlive();
  ~ScopedKeepAlive();
  ScopedKeepAlive(const ScopedKeepAlive&) = delete;
  ScopedKeepAlive& operator=(const ScopedKeepAlive&) = delete;
};

// Opens one transaction and has `queue` end it `interval` from now. Without a queue
// nothing could end it later, so it is not opened at all.
void KeepAliveFor(BackgroundQueue* queue, std::chrono::milliseconds interval);

}  // namespace brisvale
