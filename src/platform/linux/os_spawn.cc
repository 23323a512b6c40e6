// Starting the external check and mount tools and waiting for them.
#include <spawn.h>
#include <sys/wait.h>

#include <cerrno>

#include "platform/linux/os_system.h"

namespace brisvale::os {

int LinuxOs::SpawnProgram(const std::vector<std::string>& argv) {
  if (argv.empty()) return -EINVAL;
  std::vector<char*> arguments;
  arguments.reserve(argv.size() + 1);
  for (const std::string& argument : argv) arguments.push_back(const_cast<char*>(argument.c_str()));
  arguments.push_back(nullptr);
  char* environment[] = {nullptr};
  pid_t pid = -1;
  // glibc's posix_spawn reports a failed exec (a missing tool) as its own result.
  const int error = posix_spawn(&pid, arguments[0], nullptr, nullptr, arguments.data(), environment);
  return error != 0 ? -error : pid;
}

int LinuxOs::WaitForChild(int pid, int& waitStatus) {
  for (;;) {
    if (waitpid(pid, &waitStatus, 0) >= 0) return 0;
    if (errno != EINTR) return -errno;
  }
}

}  // namespace brisvale::os
