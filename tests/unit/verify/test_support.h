// Helpers of the verification tests: files of the development PKI and the signing tool.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/os.h"
#include "platform/services.h"
#include "test_files.h"

namespace brisvale::testing {

using Bytes = std::vector<uint8_t>;

// The verifiers read image and certificate files through the services table.
inline const ScopedServices kSystemOsForVerifyTests(Services{.os = &os::SystemOs()});

// A file of the development PKI.
inline std::string Pki(const std::string& name) { return std::string(BRISVALE_PKI_DIR) + "/" + name; }

// Runs brisvale-imgtool with the arguments; true when it exits 0.
inline bool RunImgtool(const std::vector<std::string>& args) {
  std::string command = BRISVALE_IMGTOOL;
  for (const std::string& arg : args) command += " '" + arg + "'";  // no argument holds a quote
  return std::system(command.c_str()) == 0;
}

}  // namespace brisvale::testing
