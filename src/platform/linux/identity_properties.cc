// Device identity from the root-owned property list the boot chain writes.
#include <algorithm>
#include <fstream>
#include <iterator>
#include <mutex>
#include <vector>

#include "platform/device_properties.h"

namespace brisvale::device {
namespace {

std::mutex pathMutex;
std::string& OverridePath() {
  static std::string path;
  return path;
}

std::string IdentityPath() {
  std::lock_guard lock(pathMutex);
  return OverridePath().empty() ? std::string(kDeviceIdentityPath) : OverridePath();
}

}  // namespace

ValueKind IdentityValue::kind() const {
  switch (value_.kind()) {
    case plist::Kind::String: return ValueKind::Text;
    case plist::Kind::Data: return ValueKind::Data;
    case plist::Kind::Integer:
    case plist::Kind::Real:
    case plist::Kind::Boolean: return ValueKind::Number;
    default: return ValueKind::Other;
  }
}

std::optional<uint64_t> IdentityValue::int64() const {
  if (auto integer = value_.integer()) return integer->asUnsigned();
  if (auto flag = value_.boolean()) return *flag ? 1 : 0;
  if (auto real = value_.real()) {
    // Converting a real outside the integer's range (or NaN) is undefined: such a value
    // answers none. Negative ones keep the two's complement the integer kind has.
    constexpr double kTwoTo63 = 9223372036854775808.0;
    if (*real >= -kTwoTo63 && *real < kTwoTo63) return static_cast<uint64_t>(static_cast<int64_t>(*real));
    if (*real >= kTwoTo63 && *real < 2 * kTwoTo63) return static_cast<uint64_t>(*real);
  }
  return std::nullopt;
}

std::optional<uint32_t> IdentityValue::int32() const {
  if (auto wide = int64()) return static_cast<uint32_t>(*wide);
  return std::nullopt;
}

std::optional<bool> IdentityValue::boolean() const {
  if (auto flag = value_.boolean()) return *flag;
  if (auto real = value_.real()) return *real != 0;
  if (auto integer = value_.integer()) return integer->value != 0;
  return std::nullopt;
}

bool IdentityValue::DataEquals(std::span<const uint8_t> bytes) const {
  const plist::Bytes* mine = value_.data();
  return mine && std::equal(mine->begin(), mine->end(), bytes.begin(), bytes.end());
}

std::optional<IdentityValue> DeviceIdentity::Copy(std::string_view key) const {
  const plist::Value* value = values_.find(key);
  if (!value) return std::nullopt;
  return IdentityValue(*value);
}

DeviceIdentity ReadDeviceIdentity() {
  std::ifstream file(IdentityPath(), std::ios::binary);
  if (!file) return DeviceIdentity();
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(file)),
                             std::istreambuf_iterator<char>());
  if (file.bad()) return DeviceIdentity();
  std::optional<plist::Value> root = plist::Read(bytes);
  if (!root || !root->dictionary()) return DeviceIdentity();
  return DeviceIdentity(*root->dictionary());
}

void SetDeviceIdentityPath(std::string path) {
  std::lock_guard lock(pathMutex);
  OverridePath() = std::move(path);
}

}  // namespace brisvale::device
