// brisvalectl: the command-line client of brisvale-mounterd.
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "base/plist.h"
#include "alert_agent.h"
#include "jobs_command.h"
#include "json.h"
#include "mount_image.h"
#include "mount_storage.h"
#include "platform/linux/ipc_client.h"
#include "platform/linux/notify_center.h"

namespace {

using namespace brisvale;

constexpr const char* kServiceName = "com.vantrel.brisvale_mounter.vexa";
constexpr const char* kHardwareEventStream = "com.vantrel.kestrix.matching";
constexpr auto kRequestTimeout = std::chrono::minutes(5);  // a verified mount can take long

// Exit statuses.
constexpr int kOk = 0;
constexpr int kRequestFailed = 1;  // the daemon answered "Failure"
constexpr int kUsage = 2;
constexpr int kNotRunning = 3;
constexpr int kTransportError = 4;  // cancelled, timed out or unreadable reply

struct Options {
  std::string root;  // sandbox root of the daemon, "" for the real one
  bool json = false;
  std::optional<int> autoDismissSeconds;  // alert-agent only
  std::vector<std::string> arguments;
};

void PrintUsage(FILE* out) {
  std::fputs(
      "usage: brisvalectl [--root DIR] [--json] COMMAND [ARGS]\n"
      "commands:\n"
      "  list              list attached and mounted devices (CopyDevices)\n"
      "  jobs              list the jobs loaded into the service launcher's spool\n"
      "  raw FILE          send the request property list in FILE (XML or binary) and\n"
      "                    print the reply\n"
      "  post-event NAME   post NAME on the hardware event stream (root only)\n"
      "  mount-image --type Developer|Factory|Personalized --signature FILE IMAGE [--consume]\n"
      "                    verify and mount a disk image; prints the mount path. A copy\n"
      "                    is staged inside the daemon's root unless --consume hands\n"
      "                    IMAGE itself over (the daemon removes what it is given)\n"
      "  mount-storage NODE [--read-only]\n"
      "                    check and mount the attached removable medium NODE (such\n"
      "                    as /dev/sdb1); prints the mount path\n"
      "  unmount PATH      take away the file system mounted at PATH\n"
      "  sync PATH         flush the file system mounted at PATH to its device\n"
      "  watch             print system notifications as they arrive, until interrupted\n"
      "                    (with --json one JSON object a line)\n"
      "  alert-agent       show user alerts and answer each when Enter is pressed\n"
      "                    (with --json one JSON object a line)\n"
      "options:\n"
      "  --root DIR        talk to a daemon running in the sandbox root DIR\n"
      "  --json            print replies as JSON\n"
      "  --auto-dismiss S  alert-agent: answer each alert after S seconds\n"
      "exit status: 0 success, 1 the daemon answered Failure, 2 usage, 3 daemon not\n"
      "running, 4 connection cancelled, timed out or unreadable reply, 5 a local file\n"
      "could not be read or staged\n",
      out);
}

std::string SocketPath(const Options& options, const char* name) {
  return options.root + "/var/run/vexa/" + name;
}

int TransportExit(const ipc::ClientReply& reply) {
  std::fprintf(stderr, "brisvalectl: %s\n", reply.error.c_str());
  return reply.status == ipc::ClientStatus::NotRunning ? kNotRunning : kTransportError;
}

// Sends one request dictionary and returns the decoded reply dictionary, or an exit
// status after printing why there is none.
std::variant<plist::Value, int> SendRequest(const Options& options, const plist::Value& request) {
  ipc::ClientReply failure;
  std::optional<ipc::Client> client = ipc::Client::Connect(SocketPath(options, kServiceName), &failure);
  if (!client) return TransportExit(failure);
  plist::Dictionary message;
  message.set("EncodedDictionary", plist::Value(plist::WriteBinary(request)));
  ipc::ClientReply reply = client->Request(message, kRequestTimeout);
  if (!reply.ok()) {
    if (reply.status == ipc::ClientStatus::Cancelled) {
      reply.error = "the daemon closed the connection without a reply (request refused)";
    }
    return TransportExit(reply);
  }
  const plist::Value* encoded = reply.body.find("EncodedDictionary");
  std::optional<plist::Value> decoded;
  if (encoded && encoded->data()) decoded = plist::Read(*encoded->data());
  if (!decoded || !decoded->dictionary()) {
    std::fprintf(stderr, "brisvalectl: the reply carries no readable dictionary\n");
    return kTransportError;
  }
  return *decoded;
}

bool Succeeded(const plist::Value& reply) {
  const std::string* status = reply.getString("Status");
  return status && *status == "Success";
}

std::string Cell(const plist::Value& entry, const char* key) {
  const plist::Value* value = entry.get(key);
  // A camera has no node; its USB location names it.
  if (!value && std::string_view(key) == "DeviceNode" && entry.get("LocationID")) {
    if (std::optional<plist::Integer> location = entry.get("LocationID")->integer()) {
      char name[32];
      std::snprintf(name, sizeof name, "usb@0x%08llx", static_cast<unsigned long long>(location->asUnsigned()));
      return name;
    }
  }
  if (!value) return "-";
  if (std::optional<bool> flag = value->boolean()) return *flag ? "yes" : "no";
  return value->description();
}

void PrintTable(const plist::Array& entries) {
  const char* columns[] = {"DeviceNode", "DeviceType", "MountPath", "FilesystemType", "IsReadOnly"};
  const char* headers[] = {"DEVICE", "TYPE", "MOUNT PATH", "FILE SYSTEM", "READ-ONLY"};
  std::vector<std::vector<std::string>> rows;
  rows.emplace_back(std::begin(headers), std::end(headers));
  for (const plist::Value& entry : entries) {
    std::vector<std::string> row;
    for (const char* column : columns) row.push_back(Cell(entry, column));
    rows.push_back(std::move(row));
  }
  std::sort(rows.begin() + 1, rows.end());  // the listing comes in no defined order
  std::vector<size_t> widths(std::size(columns), 0);
  for (const auto& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  for (const auto& row : rows) {
    std::string line;
    for (size_t i = 0; i < row.size(); ++i) {
      line += row[i];
      if (i + 1 < row.size()) line.append(widths[i] - row[i].size() + 2, ' ');
    }
    std::printf("%s\n", line.c_str());
  }
}

int PrintReply(const Options& options, const plist::Value& reply) {
  if (options.json) {
    std::printf("%s\n", tools::ToJson(reply).c_str());
  } else {
    std::string xml = plist::WriteXml(reply);
    std::fwrite(xml.data(), 1, xml.size(), stdout);
  }
  return Succeeded(reply) ? kOk : kRequestFailed;
}

int List(const Options& options) {
  auto result = SendRequest(options, plist::Dictionary{{"RequestType", "CopyDevices"}});
  if (int* status = std::get_if<int>(&result)) return *status;
  const plist::Value& reply = std::get<plist::Value>(result);
  if (!Succeeded(reply)) {
    std::fprintf(stderr, "brisvalectl: the daemon answered Failure\n");
    return kRequestFailed;
  }
  const plist::Value* entries = reply.get("EntryList");
  plist::Array none;
  const plist::Array& list = entries && entries->array() ? *entries->array() : none;
  if (options.json) {
    std::printf("%s\n", tools::ToJson(plist::Value(list)).c_str());
  } else {
    PrintTable(list);
  }
  return kOk;
}

int Raw(const Options& options, const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) {
    std::fprintf(stderr, "brisvalectl: cannot read %s: %s\n", path.c_str(), std::strerror(errno));
    return kUsage;
  }
  plist::Bytes bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  std::string error;
  std::optional<plist::Value> request = plist::Read(bytes, &error);
  if (!request) {
    std::fprintf(stderr, "brisvalectl: %s is not a property list: %s\n", path.c_str(), error.c_str());
    return kUsage;
  }
  auto result = SendRequest(options, *request);
  if (int* status = std::get_if<int>(&result)) return *status;
  return PrintReply(options, std::get<plist::Value>(result));
}

int PostEvent(const Options& options, const std::string& name) {
  ipc::ClientReply reply =
      ipc::PostEvent(SocketPath(options, "events"), kHardwareEventStream, name);
  if (!reply.ok()) return TransportExit(reply);
  std::printf("posted %s\n", name.c_str());
  return kOk;
}

// Requests that name a mount path and answer only with a status.
int MountPathRequest(const Options& options, const char* type, const std::string& mountPath) {
  auto result = SendRequest(options, plist::Dictionary{{"RequestType", type}, {"MountPath", plist::Value(mountPath)}});
  if (int* status = std::get_if<int>(&result)) return *status;
  const plist::Value& reply = std::get<plist::Value>(result);
  if (options.json) return PrintReply(options, reply);
  if (!Succeeded(reply)) {
    std::fprintf(stderr, "brisvalectl: the daemon answered Failure (its log says why)\n");
    return kRequestFailed;
  }
  std::printf("%s %s: done\n", type, mountPath.c_str());
  return kOk;
}

// JSON on one line: the pretty form with its line breaks and indentation dropped (line
// breaks inside strings are escaped, so none is lost).
std::string JsonLine(const plist::Value& value) {
  std::string line;
  bool skipIndent = false;
  for (char c : tools::ToJson(value)) {
    if (c == '\n') {
      skipIndent = true;
    } else if (!(skipIndent && c == ' ')) {
      skipIndent = false;
      line += c;
    }
  }
  return line;
}

int Watch(const Options& options) {
  std::string error;
  auto subscriber = notify::Subscriber::Create(options.root + notify::kDefaultNotifyDirectory, &error);
  if (!subscriber) {
    std::fprintf(stderr, "brisvalectl: %s\n", error.c_str());
    return kTransportError;
  }
  for (;;) {
    std::optional<notify::Notification> notification = subscriber->Receive(std::nullopt);
    if (!notification) continue;
    if (options.json) {
      plist::Dictionary object{{"name", plist::Value(notification->name)},
                               {"object", notification->object},
                               {"distributed", plist::Value::Bool(notification->distributed)}};
      if (notification->userInfo) object.set("userInfo", plist::Value(*notification->userInfo));
      std::printf("%s\n", JsonLine(plist::Value(object)).c_str());
    } else {
      std::printf("%s  object: %s  user info: %s%s\n", notification->name.c_str(),
                  notification->object.description().c_str(),
                  notification->userInfo ? plist::Value(*notification->userInfo).description().c_str() : "-",
                  notification->distributed ? "  (distributed)" : "");
    }
    std::fflush(stdout);
  }
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--root" && i + 1 < argc) {
      options.root = argv[++i];
    } else if (arg == "--auto-dismiss" && i + 1 < argc) {
      char* end = nullptr;
      long seconds = std::strtol(argv[++i], &end, 10);
      if (*end != '\0' || seconds < 0 || seconds > 86400) {
        std::fprintf(stderr, "brisvalectl: bad --auto-dismiss value %s\n", argv[i]);
        return kUsage;
      }
      options.autoDismissSeconds = static_cast<int>(seconds);
    } else if (arg == "--json") {
      options.json = true;
    } else if (arg == "--help" || arg == "-h") {
      PrintUsage(stdout);
      return kOk;
    } else if (!options.arguments.empty() && options.arguments[0] == "mount-image" &&
               (arg == "--type" || arg == "--signature" || arg == "--consume")) {
      options.arguments.push_back(arg);  // the subcommand's own options
    } else if (!options.arguments.empty() && options.arguments[0] == "mount-storage" && arg == "--read-only") {
      options.arguments.push_back(arg);
    } else if (arg.starts_with("--")) {
      std::fprintf(stderr, "brisvalectl: unknown option %s\n", arg.c_str());
      PrintUsage(stderr);
      return kUsage;
    } else {
      options.arguments.push_back(arg);
    }
  }
  const std::vector<std::string>& args = options.arguments;
  if (args.empty()) {
    PrintUsage(stderr);
    return kUsage;
  }
  const std::string& command = args[0];
  if (command == "list" && args.size() == 1) return List(options);
  if (command == "jobs" && args.size() == 1) return tools::ListJobs(options.root, options.json);
  if (command == "raw" && args.size() == 2) return Raw(options, args[1]);
  if (command == "post-event" && args.size() == 2) return PostEvent(options, args[1]);
  if (command == "unmount" && args.size() == 2) return MountPathRequest(options, "Unmount", args[1]);
  if (command == "sync" && args.size() == 2) return MountPathRequest(options, "Sync", args[1]);
  if (command == "watch" && args.size() == 1) return Watch(options);
  if (command == "alert-agent" && args.size() == 1) {
    return tools::RunAlertAgent(
        {SocketPath(options, "alert-agent"), options.autoDismissSeconds, options.json});
  }
  if (command == "mount-image") {
    return tools::MountImage({args.begin() + 1, args.end()}, options.root, options.json,
                             [&options](const plist::Value& request) { return SendRequest(options, request); });
  }
  if (command == "mount-storage") {
    return tools::MountStorage({args.begin() + 1, args.end()}, options.json,
                               [&options](const plist::Value& request) { return SendRequest(options, request); });
  }
  std::fprintf(stderr, "brisvalectl: bad command line\n");
  PrintUsage(stderr);
  return kUsage;
}
