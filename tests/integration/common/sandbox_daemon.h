// The real daemon in a throw-away sandbox root, for integration tests: started on demand,
// stopped, and the sandbox torn down, in the destructor, also when a test fails half-way.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "base/plist.h"
#include "platform/linux/ipc_client.h"

#include "test_files.h"

namespace brisvale::testing {

// Not copyable: it owns the daemon process and, through its scratch directory, the sandbox.
class SandboxDaemon {
 public:
  // The sandbox directory starts empty; Start() runs the daemon in it.
  ~SandboxDaemon();

  // Starts the daemon with --root, --verbose and `extraArguments`; waits until it listens.
  bool Start(const std::vector<std::string>& extraArguments = {});
  // Ends the daemon (SIGTERM, then SIGKILL) and waits for it; the sandbox stays.
  void Stop();
  pid_t pid() const { return pid_; }

  const std::string& root() const { return root_; }
  // A path inside the sandbox, as seen from outside ("/private/var" -> root + that).
  std::string Path(const std::string& inside) const { return root_ + inside; }
  std::string ServiceSocket() const { return Path("/private/var/run/vexa/com.vantrel.brisvale_mounter.vexa"); }

  // One request {"EncodedDictionary": the binary `request`}; the reply's decoded
  // dictionary when Ok.
  ipc::ClientReply SendRequest(const plist::Value& request,
                               std::optional<plist::Value>* decodedReply = nullptr);
  ipc::ClientReply PostHardwareEvent(const std::string& name);

  // The daemon's log so far, one line a string ("level: text").
  std::vector<std::string> LogLines() const;
  bool LogContains(const std::string& line) const;
  // Waits up to `timeout` for `line` to appear in the log.
  bool WaitForLogLine(const std::string& line,
                      std::chrono::milliseconds timeout = std::chrono::seconds(5)) const;

 private:
  const ScratchDir scratch_;
  const std::string root_ = scratch_.str();
  const std::string logPath_ = root_ + ".log";
  pid_t pid_ = -1;
};

// Runs a program, waits for it, returns its exit status (-1 if it did not exit) and
// what it printed on stdout.
int RunProgram(const std::vector<std::string>& argv, std::string* output = nullptr);

// Everything read from `fd` until every writer has closed it.
std::string ReadUntilEnd(int fd);

// One object of a `--devices` file: its class, properties and children.
inline plist::Value DeviceObject(std::string name, std::string className, plist::Dictionary properties,
                                 plist::Array children = {}) {
  return plist::Dictionary{{"Name", plist::Value(std::move(name))},
                           {"Class", plist::Value(std::move(className))},
                           {"Properties", plist::Value(std::move(properties))},
                           {"Children", plist::Value(std::move(children))}};
}

}  // namespace brisvale::testing
