// Helpers of the verification tests: files of the development PKI and the signing tool.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "test_files.h"

namespace brisvale::testing {

using Bytes = std::vector<uint8_t>;

std::string Pki(const std::string& name);  // a file of the development PKI

// Runs brisvale-imgtool with the arguments; true when it exits 0.
bool RunImgtool(const std::vector<std::string>& args);

}  // namespace brisvale::testing
