// The disk-image controller's attach input as it reads it: the first 256 bytes as the
// record, the rest as the property list the record would point to.
#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/linux/format_attach_request.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace brisvale::formats;
  const std::span<const uint8_t> input(data, size);
  const size_t recordSize = std::min(size, kAttachRecordSize);
  if (auto location = ParseAttachRecord(input.first(recordSize), nullptr)) {
    if (location->length == 0 || location->length > kMaxAttachListLength) __builtin_trap();
  }
  if (auto request = ParseAttachList(input.subspan(recordSize), nullptr)) {
    if (request->imagePath.empty() || request->imagePath.front() != '/') __builtin_trap();
    if (!IsUuidText(request->identifier)) __builtin_trap();
  }
  return 0;
}
