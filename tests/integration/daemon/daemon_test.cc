// The daemon in a sandbox root under crowds of connections over its real socket: what
// it holds stays within its limits, others are served meanwhile, and it all goes back.
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>

#include "base/unique_fd.h"
#include "platform/linux/ipc_socket.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

#ifndef __has_feature
#define __has_feature(x) 0
#endif
#if defined(__SANITIZE_ADDRESS__) || __has_feature(address_sanitizer)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

// What the daemon holds: open descriptors and anonymous memory (KiB).
std::pair<size_t, long> Holdings(pid_t pid) {
  const std::string proc = "/proc/" + std::to_string(pid);
  const auto descriptors = std::distance(std::filesystem::directory_iterator(proc + "/fd"),
                                         std::filesystem::directory_iterator());
  long rssAnon = -1;
  std::ifstream status(proc + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("RssAnon:")) rssAnon = std::stol(line.substr(8));
  }
  return {static_cast<size_t>(descriptors), rssAnon};
}

// In a child running as `uid`: opens `count` idle connections to `path` and, once they
// are all made, runs `then` and exits with its status.
pid_t AsUser(uid_t uid, const std::string& path, int count, const std::function<int()>& then) {
  const pid_t pid = fork();
  if (pid != 0) return pid;
  rlimit files{};
  getrlimit(RLIMIT_NOFILE, &files);
  files.rlim_cur = files.rlim_max;
  setrlimit(RLIMIT_NOFILE, &files);
  if (setgid(uid) != 0 || setuid(uid) != 0) _exit(2);
  for (int i = 0; i < count; ++i) {
    if (ipc::ConnectToPath(path, nullptr).release() < 0) _exit(3);  // held until the exit
  }
  _exit(then());
}

// 1,000 idle connections of one unprivileged user under a limit of 1,024 descriptors,
// then 64 connections that each send half of a 4 MB frame and stop. The crowd's surplus
// is refused with a line and the frames past the budget of all connections are
// cancelled; root is served throughout, the user again once its crowd is gone, and the
// daemon stays small and gives back what it held.
TEST(Daemon, CrowdsAndParkedFramesCannotStopOrExhaustTheService) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  ASSERT_TRUE(daemon.Start()) << "daemon did not start in " << daemon.root();
  constexpr uid_t kNobody = 65534;
  ASSERT_EQ(chmod(daemon.root().c_str(), 0755), 0);
  const rlimit limit{1024, 1024};
  ASSERT_EQ(prlimit(daemon.pid(), RLIMIT_NOFILE, &limit, nullptr), 0);
  const auto before = Holdings(daemon.pid());
  int sync[2];  // the crowd says when it is in, then holds on until the test closes its end
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sync), 0);
  const pid_t crowd = AsUser(kNobody, daemon.ServiceSocket(), 1000, [&] {
    char byte = 0;
    close(sync[0]);
    return write(sync[1], &byte, 1) == 1 && read(sync[1], &byte, 1) == 0 ? 0 : 4;
  });
  close(sync[1]);
  char byte;
  ASSERT_EQ(read(sync[0], &byte, 1), 1);
  // Root's connection queues behind the crowd's and is served once they are taken in.
  EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}).ok());
  EXPECT_TRUE(daemon.LogContains(
      "default: Refusing a vexa connection of uid 65534: 64 open of 64 for one user, 64 of 256 in all"));
  close(sync[0]);
  int status = -1;
  waitpid(crowd, &status, 0);
  EXPECT_EQ(status, 0) << "the crowd could not make its connections";
  // One more than before: the mount table the first listing opened stays open. The
  // daemon lets go of a connection a moment after its peer has gone.
  const auto settled = [&] {
    for (int i = 0; i < 500 && Holdings(daemon.pid()).first > before.first + 1; ++i) usleep(10000);
    return Holdings(daemon.pid());
  };
  settled();
  const pid_t single = AsUser(kNobody, daemon.ServiceSocket(), 0, [&] {
    return daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}).ok() ? 0 : 5;
  });
  waitpid(single, &status, 0);
  EXPECT_EQ(status, 0) << "the user was not served once its crowd had gone";
  const auto uncrowded = settled();
  EXPECT_LE(uncrowded.first, before.first + 1);

  std::vector<UniqueFd> parked;
  std::vector<uint8_t> halfFrame(4 + 2'000'000, 'x');
  const uint8_t header[4] = {0x00, 0x3D, 0x09, 0x00};  // 4,000,000 bytes follow
  std::copy_n(header, 4, halfFrame.begin());
  for (int i = 0; i < 64; ++i) {
    UniqueFd fd = ipc::ConnectToPath(daemon.ServiceSocket(), nullptr);
    ASSERT_TRUE(fd);
    fcntl(fd.get(), F_SETFL, 0);  // blocking: the send returns once all is taken in or the daemon hangs up
    send(fd.get(), halfFrame.data(), halfFrame.size(), MSG_NOSIGNAL);
    parked.push_back(std::move(fd));
  }
  EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}).ok());
  const auto during = Holdings(daemon.pid());
  parked.clear();
  EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}).ok());
  usleep(200000);
  const auto after = Holdings(daemon.pid());
  // AddressSanitizer keeps freed memory in quarantine, so the daemon's own footprint
  // only shows in an uninstrumented build.
  if (!kSanitized) {
    EXPECT_LT(during.second, uncrowded.second + 40 * 1024);  // the 32 MiB budget and what is being read
    EXPECT_LE(after.second, uncrowded.second + 1024);
  }
  EXPECT_TRUE(std::ranges::any_of(daemon.LogLines(), [](const std::string& line) {
    return line.find("over the budget") != std::string::npos;
  }));
}

}  // namespace
}  // namespace brisvale::testing
