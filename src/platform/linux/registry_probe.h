// What the system-devices provider learns from a block device's node rather than from
// sysfs: the partition table (libblkid), the identifier the disk-image driver stores in
// a loop device, and the node itself, made with mknod when the device root lacks it.
#pragma once

#include <sys/types.h>

#include <map>
#include <optional>
#include <string>

namespace brisvale::registry::sysfs {

struct PartitionTable {
  std::string scheme;                      // "" when the disk has no partition table
  std::map<int, std::string> contentByNumber;  // partition number -> "Content"
};

// Reads the partition table of the whole disk at `node`. None when the node cannot be
// opened or probed.
std::optional<PartitionTable> ProbePartitionTable(const std::string& node);

// The "Content" of a whole disk: its scheme name when partitioned, "" otherwise.
// "GPT_partition_scheme" / "MBR_partition_scheme" for libblkid's "gpt" / "dos".
std::string SchemeContent(const std::string& blkidTableType);
// The "Content" of one partition: a GPT type GUID in upper case, or "0xNN" (two upper
// case hex digits) for an MBR type.
std::string PartitionContent(const char* gptTypeGuid, int mbrType);

// The unique identifier the disk-image driver left in the loop device's file name
// field, when that field holds one (a UUID in its 8-4-4-4-12 form); none otherwise.
std::optional<std::string> ReadLoopIdentifier(const std::string& node);

// Makes the block node `path` for `number` when nothing exists at that path. Answers
// true when it made the node. Failures are logged.
bool EnsureBlockNode(const std::string& path, dev_t number);
// Removes a node this provider made, if it is still that block device.
void RemoveBlockNode(const std::string& path, dev_t number);

}  // namespace brisvale::registry::sysfs
