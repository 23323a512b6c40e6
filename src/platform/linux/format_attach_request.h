// The disk-image controller's attach request: the 256-byte record its caller hands to
// selector 0, and the XML property list that record points to. Both are untrusted:
// nothing in them is used for a length or an address before it has been checked here.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace brisvale::formats {

inline constexpr size_t kAttachRecordSize = 256;
inline constexpr uint32_t kAttachRecordMagic = 0xBEEFFEED;
inline constexpr uint32_t kAttachRecordVersion = 1;
// An attach list holds an identifier and one path of at most 1024 bytes; anything
// beyond this is not an attach list.
inline constexpr uint64_t kMaxAttachListLength = 64 * 1024;

// Where the caller's property list lies, as the record says.
struct AttachListLocation {
  uint64_t address = 0;
  uint64_t length = 0;
};

// The record's fields once magic, version, the high words, the length bound and the
// reserved bytes have been checked. None, with `error` set, otherwise.
std::optional<AttachListLocation> ParseAttachRecord(std::span<const uint8_t> record, std::string* error);

// The identity of the file the caller verified.
struct FileIdentity {
  uint64_t device = 0;
  uint64_t inode = 0;
};

// True for a UUID in its canonical 8-4-4-4-12 text form.
bool IsUuidText(std::string_view text);

struct AttachRequest {
  std::string identifier;  // "nimbrel-unique-identifier"
  std::string imagePath;   // "image-path"
  std::optional<FileIdentity> verifiedFile;  // "image-device" and "image-inode", both or neither
};

// The attach list's contents. None, with `error` set, when it is not an XML property
// list dictionary with a text identifier in the UUID form and a data path that is
// absolute, has no NUL byte and fits the platform's path buffer.
std::optional<AttachRequest> ParseAttachList(std::span<const uint8_t> list, std::string* error);

}  // namespace brisvale::formats
