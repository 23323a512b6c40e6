// Starts, talks to and tears down the real daemon in a throw-away sandbox root.
#include "sandbox_daemon.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/linux/os_sandbox.h"

namespace brisvale::testing {
namespace {

constexpr const char* kServiceName = "com.vantrel.brisvale_mounter.vexa";
constexpr const char* kHardwareEventStream = "com.vantrel.kestrix.matching";

bool WaitForExit(pid_t pid, std::chrono::milliseconds timeout) {
  for (auto deadline = std::chrono::steady_clock::now() + timeout; std::chrono::steady_clock::now() < deadline;) {
    const pid_t done = waitpid(pid, nullptr, WNOHANG);
    if (done == pid || (done < 0 && errno == ECHILD)) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return false;
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

std::string SandboxDaemon::ServiceSocket() const {
  return Path("/private/var/run/vexa/") + kServiceName;
}

std::string SandboxDaemon::EventsSocket() const { return Path("/private/var/run/vexa/events"); }

bool SandboxDaemon::Start(const std::vector<std::string>& extraArguments, int listenFd) {
  if (pid_ > 0) return false;
  std::vector<std::string> arguments = {BRISVALE_DAEMON_PATH, "--root", root_, "--verbose"};
  arguments.insert(arguments.end(), extraArguments.begin(), extraArguments.end());
  pid_ = fork();
  if (pid_ < 0) return false;
  if (pid_ == 0) {
    int log = open(logPath_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (log >= 0) dup2(log, STDERR_FILENO);
    if (listenFd >= 0) {
      if (listenFd != 3) dup2(listenFd, 3);
      fcntl(3, F_SETFD, 0);
      setenv("LISTEN_FDS", "1", 1);
      setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    }
    Exec(arguments);
  }
  // Listening once a client can connect. A daemon given its listener by activation
  // binds only the events socket itself.
  const std::string readySocket = listenFd >= 0 ? EventsSocket() : ServiceSocket();
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (std::chrono::steady_clock::now() < deadline) {
    if (ipc::Client::Connect(readySocket)) return true;
    if (waitpid(pid_, nullptr, WNOHANG) == pid_) {  // exited before it listened
      pid_ = -1;
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return false;
}

void SandboxDaemon::Stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  if (!WaitForExit(pid_, std::chrono::seconds(5))) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  pid_ = -1;
}

ipc::ClientReply SandboxDaemon::SendEncoded(const plist::Bytes& encoded,
                                            std::optional<plist::Value>* decodedReply) {
  ipc::ClientReply failure;
  std::optional<ipc::Client> client = ipc::Client::Connect(ServiceSocket(), &failure);
  if (!client) return failure;
  ipc::ClientReply reply =
      client->Request(plist::Dictionary{{"EncodedDictionary", plist::Value(encoded)}},
                      std::chrono::seconds(30));
  if (reply.ok() && decodedReply) {
    const plist::Value* bytes = reply.body.find("EncodedDictionary");
    if (bytes && bytes->data()) {
      // Replies are always binary property lists.
      *decodedReply = plist::ReadBinary(*bytes->data());
    }
  }
  return reply;
}

ipc::ClientReply SandboxDaemon::SendRequest(const plist::Value& request,
                                            std::optional<plist::Value>* decodedReply) {
  return SendEncoded(plist::WriteBinary(request), decodedReply);
}

ipc::ClientReply SandboxDaemon::PostHardwareEvent(const std::string& name) {
  return ipc::PostEvent(EventsSocket(), kHardwareEventStream, name);
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

bool SandboxDaemon::WaitForLogLine(const std::string& line,
                                   std::chrono::milliseconds timeout) const {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  do {
    if (LogContains(line)) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  } while (std::chrono::steady_clock::now() < deadline);
  return false;
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
