#include "platform/linux/format_attach_request.h"

#include <algorithm>
#include <cctype>
#include <cstring>

#include "base/plist.h"

namespace brisvale::formats {
namespace {

constexpr size_t kMaxPathLength = 1023;  // the platform's 1024-byte buffer, terminator included

uint32_t Little32(std::span<const uint8_t> bytes, size_t offset) {
  return uint32_t{bytes[offset]} | uint32_t{bytes[offset + 1]} << 8 | uint32_t{bytes[offset + 2]} << 16 |
         uint32_t{bytes[offset + 3]} << 24;
}

uint64_t Little64(std::span<const uint8_t> bytes, size_t offset) {
  return uint64_t{Little32(bytes, offset)} | uint64_t{Little32(bytes, offset + 4)} << 32;
}

}  // namespace

bool IsUuidText(std::string_view text) {
  if (text.size() != 36) return false;
  for (size_t i = 0; i < text.size(); ++i) {
    const bool dash = i == 8 || i == 13 || i == 18 || i == 23;
    if (dash ? text[i] != '-' : !std::isxdigit(static_cast<unsigned char>(text[i]))) return false;
  }
  return true;
}

namespace {

template <typename T>
std::optional<T> Fail(std::string* error, const char* reason) {
  if (error) *error = reason;
  return std::nullopt;
}

}  // namespace

std::optional<AttachListLocation> ParseAttachRecord(std::span<const uint8_t> record, std::string* error) {
  using Result = AttachListLocation;
  if (record.size() != kAttachRecordSize) return Fail<Result>(error, "record is not 256 bytes");
  if (Little32(record, 0) != kAttachRecordMagic) return Fail<Result>(error, "bad magic");
  if (Little32(record, 4) != kAttachRecordVersion) return Fail<Result>(error, "unknown version");
  const AttachListLocation location{Little64(record, 8), Little64(record, 16)};
  if (location.address == 0) return Fail<Result>(error, "no property list");
  if (location.length == 0 || location.length > kMaxAttachListLength) {
    return Fail<Result>(error, "property list length out of range");
  }
  if (location.address + location.length < location.address) return Fail<Result>(error, "address wraps");
  if (std::any_of(record.begin() + 24, record.end(), [](uint8_t byte) { return byte != 0; })) {
    return Fail<Result>(error, "reserved bytes set");
  }
  return location;
}

std::optional<AttachRequest> ParseAttachList(std::span<const uint8_t> list, std::string* error) {
  const std::optional<plist::Value> root = plist::ReadXml(list);
  if (!root || !root->dictionary()) return Fail<AttachRequest>(error, "not an XML dictionary");
  AttachRequest request;
  const std::string* identifier = root->getString("nimbrel-unique-identifier");
  if (!identifier || !IsUuidText(*identifier)) return Fail<AttachRequest>(error, "bad identifier");
  request.identifier = *identifier;
  const plist::Value* path = root->get("image-path");
  const plist::Bytes* pathBytes = path ? path->data() : nullptr;
  if (!pathBytes || pathBytes->empty() || pathBytes->size() > kMaxPathLength || pathBytes->front() != '/' ||
      std::find(pathBytes->begin(), pathBytes->end(), 0) != pathBytes->end()) {
    return Fail<AttachRequest>(error, "bad image path");
  }
  request.imagePath.assign(pathBytes->begin(), pathBytes->end());
  const plist::Value* device = root->get("image-device");
  const plist::Value* inode = root->get("image-inode");
  if (device || inode) {
    const auto deviceNumber = device ? device->integer() : std::nullopt;
    const auto inodeNumber = inode ? inode->integer() : std::nullopt;
    if (!deviceNumber || !inodeNumber) return Fail<AttachRequest>(error, "bad verified file identity");
    request.verifiedFile = FileIdentity{deviceNumber->asUnsigned(), inodeNumber->asUnsigned()};
  }
  return request;
}

}  // namespace brisvale::formats
