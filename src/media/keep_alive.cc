#include "media/keep_alive.h"

#include "base/runloop.h"
#include "platform/ipc_service.h"
#include "platform/services.h"

namespace brisvale {

ScopedKeepAlive::ScopedKeepAlive() {
  if (ipc::IpcService* ipc = CurrentServices().ipc) ipc->BeginTransaction();
}

ScopedKeepAlive::~ScopedKeepAlive() {
  if (ipc::IpcService* ipc = CurrentServices().ipc) ipc->EndTransaction();
}

void KeepAliveFor(BackgroundQueue* queue, std::chrono::milliseconds interval) {
  ipc::IpcService* ipc = CurrentServices().ipc;
  if (!queue || !ipc) return;
  ipc->BeginTransaction();
  // The task touches nothing but the counter, which the transport keeps thread-safe; it
  // ends one transaction whatever became of the subscription that opened it.
  queue->PostAfter(interval, [ipc] { ipc->EndTransaction(); });
}

}  // namespace brisvale
