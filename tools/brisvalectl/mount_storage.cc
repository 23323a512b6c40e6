#include "mount_storage.h"

#include <cstdio>


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
  return PrintMountReply(std::get<plist::Value>(result), json);
}

}  // namespace brisvale::tools
