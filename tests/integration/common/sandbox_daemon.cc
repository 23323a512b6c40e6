// Starts, talks to and tears down the real daemon in a throw-away sandbox root.
#include "sandbox_daemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include "platform/linux/os_sandbox.h"

namespace brisvale::testing {
namespace {

constexpr const char* kHardwareEventStream = "com.vantrel.kestrix.matching";

// Asks `done` every few milliseconds until it holds (true) or `timeout` has passed.
bool PollUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!done()) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

[[noreturn]] void Exec(const std::vector<std::string>& arguments) {
  std::vector<char*> argv;
  for (const std::string& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
  argv.push_back(nullptr);
  execv(argv[0], argv.data());
  _exit(127);
}

}  // namespace

SandboxDaemon::~SandboxDaemon() {
  Stop();
  // The daemon's own teardown, so that the scratch directory holds no mounts when it goes.
  std::string output;
  if (std::filesystem::exists(Path(std::string("/") + linux_os::kSandboxMarker)) &&
      RunProgram({BRISVALE_DAEMON_PATH, "--root", root_, "--teardown"}, &output) != 0) {
    ADD_FAILURE() << "teardown of " << root_ << " failed: " << output;
  }
  unlink(logPath_.c_str());
}

bool SandboxDaemon::Start(const std::vector<std::string>& extraArguments) {
  if (pid_ > 0) return false;
  std::vector<std::string> arguments = {BRISVALE_DAEMON_PATH, "--root", root_, "--verbose"};
  arguments.insert(arguments.end(), extraArguments.begin(), extraArguments.end());
  pid_ = fork();
  if (pid_ < 0) return false;
  if (pid_ == 0) {
    const int log = open(logPath_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (log >= 0) dup2(log, STDERR_FILENO);
    Exec(arguments);
  }
  // Listening once a client can connect; a daemon that exited first never will.
  bool exited = false;
  const bool listening = PollUntil([&] {
    if (ipc::Client::Connect(ServiceSocket())) return true;
    exited = waitpid(pid_, nullptr, WNOHANG) == pid_;
    return exited;
  }, std::chrono::seconds(10));
  if (exited) pid_ = -1;
  return listening && !exited;
}

void SandboxDaemon::Stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  const auto exited = [this] {
    const pid_t done = waitpid(pid_, nullptr, WNOHANG);
    return done == pid_ || (done < 0 && errno == ECHILD);
  };
  if (!PollUntil(exited, std::chrono::seconds(5))) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  pid_ = -1;
}

ipc::ClientReply SandboxDaemon::SendRequest(const plist::Value& request,
                                            std::optional<plist::Value>* decodedReply) {
  ipc::ClientReply failure;
  std::optional<ipc::Client> client = ipc::Client::Connect(ServiceSocket(), &failure);
  if (!client) return failure;
  const plist::Dictionary wrapped{{"EncodedDictionary", plist::Value(plist::WriteBinary(request))}};
  ipc::ClientReply reply = client->Request(wrapped, std::chrono::seconds(30));
  const plist::Value* bytes = reply.ok() ? reply.body.find("EncodedDictionary") : nullptr;
  // Replies are always binary property lists.
  if (decodedReply && bytes && bytes->data()) *decodedReply = plist::ReadBinary(*bytes->data());
  return reply;
}

ipc::ClientReply SandboxDaemon::PostHardwareEvent(const std::string& name) {
  return ipc::PostEvent(Path("/private/var/run/vexa/events"), kHardwareEventStream, name);
}

std::vector<std::string> SandboxDaemon::LogLines() const {
  std::vector<std::string> lines;
  std::ifstream log(logPath_);
  for (std::string line; std::getline(log, line);) lines.push_back(line);
  return lines;
}

bool SandboxDaemon::LogContains(const std::string& line) const {
  return std::ranges::count(LogLines(), line) > 0;
}

bool SandboxDaemon::WaitForLogLine(const std::string& line, std::chrono::milliseconds timeout) const {
  return PollUntil([&] { return LogContains(line); }, timeout);
}

int RunProgram(const std::vector<std::string>& argv, std::string* output) {
  int pipeFds[2];
  if (pipe2(pipeFds, O_CLOEXEC) != 0) return -1;
  pid_t pid = fork();
  if (pid < 0) return -1;
  if (pid == 0) {
    dup2(pipeFds[1], STDOUT_FILENO);
    dup2(pipeFds[1], STDERR_FILENO);
    Exec(argv);
  }
  close(pipeFds[1]);
  std::string text = ReadUntilEnd(pipeFds[0]);
  close(pipeFds[0]);
  int status;
  waitpid(pid, &status, 0);
  if (output) *output = text;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string ReadUntilEnd(int fd) {
  std::string text;
  char buffer[4096];
  for (ssize_t n; (n = read(fd, buffer, sizeof buffer)) > 0;) text.append(buffer, n);
  return text;
}

}  // namespace brisvale::testing
