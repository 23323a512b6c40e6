// Helpers of the verification tests: files of the development PKI and the signing tool.
#include "test_support.h"

#include <cstdlib>

#include "platform/os.h"
#include "platform/services.h"

namespace brisvale::testing {
namespace {

// The verifiers read image and certificate files through the services table.
const ScopedServices systemOs(Services{.os = &os::SystemOs()});

}  // namespace

std::string Pki(const std::string& name) { return std::string(BRISVALE_PKI_DIR) + "/" + name; }

bool RunImgtool(const std::vector<std::string>& args) {
  std::string command = BRISVALE_IMGTOOL;
  for (const std::string& arg : args) command += " '" + arg + "'";  // no argument holds a quote
  return std::system(command.c_str()) == 0;
}

}  // namespace brisvale::testing
