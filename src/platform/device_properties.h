// The device's identity values (nonce, board, chip, unique chip id, production and
// security modes, hash method), read by key. A snapshot is taken once per verification
// so that every check of one manifest sees the same values.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "base/plist.h"

namespace brisvale::device {

inline constexpr std::string_view kDeviceIdentityPath = "/var/run/vexa/device-identity.plist";

// How a value may be read. Booleans, integers and reals are all numbers.
enum class ValueKind { Text, Data, Number, Other };

// One identity value.
class IdentityValue {
 public:
  explicit IdentityValue(plist::Value value) : value_(std::move(value)) {}

  ValueKind kind() const;
  const std::string* text() const { return value_.string(); }
  const plist::Bytes* data() const { return value_.data(); }
  // Number readings; none when the value is not a number. Integers keep their low 32
  // (or 64) bits, booleans read as 0 or 1, and a number is true when non-zero.
  std::optional<uint32_t> int32() const;
  std::optional<uint64_t> int64() const;
  std::optional<bool> boolean() const;
  // Byte-for-byte comparison with a data value; false when this is not data.
  bool DataEquals(std::span<const uint8_t> bytes) const;

  const plist::Value& value() const { return value_; }

 private:
  plist::Value value_;
};

class DeviceIdentity {
 public:
  DeviceIdentity() = default;
  explicit DeviceIdentity(plist::Dictionary values) : values_(std::move(values)) {}

  // A new value for the key, or none when the key is missing.
  std::optional<IdentityValue> Copy(std::string_view key) const;

 private:
  plist::Dictionary values_;
};

// Reads the identity now. A missing or unreadable source, or one that is not a
// dictionary, gives an identity in which every key is missing.
DeviceIdentity ReadDeviceIdentity();

// Where ReadDeviceIdentity reads from on this platform: kDeviceIdentityPath unless a
// test or sandbox has pointed it elsewhere. An empty path restores the default.
void SetDeviceIdentityPath(std::string path);

}  // namespace brisvale::device
