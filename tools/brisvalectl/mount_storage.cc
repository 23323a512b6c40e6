#include "mount_storage.h"

#include <cstdio>

#include "json.h"

namespace brisvale::tools {

int MountStorage(const std::vector<std::string>& arguments, bool json, const RequestSender& send) {
  std::string node;
  bool readOnly = false;
  for (const std::string& argument : arguments) {
    if (argument == "--read-only") {
      readOnly = true;
    } else if (node.empty() && !argument.starts_with("-")) {
      node = argument;
    } else {
      node.clear();
      break;
    }
  }
  if (node.empty()) {
    std::fprintf(stderr, "usage: brisvalectl mount-storage NODE [--read-only]\n");
    return 2;
  }
  plist::Dictionary request{{"RequestType", "Mount"}, {"DeviceType", "MassStorage"}, {"DeviceNode", plist::Value(node)}};
  if (readOnly) request.set("MountReadOnly", plist::Value::Bool(true));

  auto result = send(plist::Value(std::move(request)));
  if (const int* status = std::get_if<int>(&result)) return *status;
  const plist::Value& reply = std::get<plist::Value>(result);
  const std::string* status = reply.getString("Status");
  const bool ok = status && *status == "Success";
  if (json) {
    std::printf("%s\n", ToJson(reply).c_str());
  } else if (ok) {
    // A FAT or exFAT medium is listed but not mounted: its "mount path" is the node.
    const std::string* mountPath = reply.getString("MountPath");
    std::printf("%s\n", mountPath ? mountPath->c_str() : "");
  } else {
    std::fprintf(stderr, "brisvalectl: the daemon answered Failure (its log says why)\n");
  }
  return ok ? 0 : 1;
}

}  // namespace brisvale::tools
