// "Sync": flushes one of the daemon's mounted file systems and waits until its data is
// on the device.
#include <string>

#include "base/log.h"
#include "daemon/request_handlers.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {

void HandleSync(const plist::Value& request, plist::Dictionary& reply) {
  const plist::Value* mountPath = request.get("MountPath");
  if (!mountPath || !mountPath->string()) {
    Log(Level::Default, "Failed to extract %@ from request", plist::Value("MountPath"));
    return;
  }
  // Only an entry's existence matters: the inventory decides what may be flushed.
  if (!CopyEntryForMountPath(*mountPath->string())) {
    Log(Level::Default, "There is no matching entry for %@.", *mountPath);
    return;
  }
  const std::string& path = *mountPath->string();
  if (path.size() > os::kPathBufferSize || path.find('\0') != std::string::npos) {
    Log(Level::Default, "Failed to create string.");
    return;
  }
  Log(Level::Debug, "Syncing %s.", path.c_str());
  if (const int rc = CurrentServices().os->SyncFilesystem(path.c_str()); rc < 0) {
    Log(Level::Default, "Failed to force the sync %s: %{errno}d", path.c_str(), -rc);
    return;
  }
  reply.set("Status", plist::Value("Success"));
}

}  // namespace brisvale
