// Helpers of the verification tests: files of the development PKI and the signing tool.
#include "test_support.h"

#include <sys/wait.h>
#include <unistd.h>

#include "platform/os.h"
#include "platform/services.h"

namespace brisvale::testing {
namespace {

// The verifiers read image and certificate files through the services table.
const ScopedServices systemOs(Services{.os = &os::SystemOs()});

}  // namespace

std::string Pki(const std::string& name) { return std::string(BRISVALE_PKI_DIR) + "/" + name; }

bool RunImgtool(const std::vector<std::string>& args) {
  std::vector<char*> argv{const_cast<char*>(BRISVALE_IMGTOOL)};
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  pid_t child = fork();
  if (child == 0) {
    execv(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child) return false;
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

}  // namespace brisvale::testing
