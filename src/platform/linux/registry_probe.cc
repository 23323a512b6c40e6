#include "platform/linux/registry_probe.h"
#include "base/unique_fd.h"

#include <blkid/blkid.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include "base/c_handle.h"
#include "base/log.h"
#include "platform/linux/format_attach_request.h"
#include "platform/linux/loop_device.h"

namespace brisvale::registry::sysfs {
namespace {

using Fd = UniqueFd;

}  // namespace

std::string SchemeContent(const std::string& blkidTableType) {
  if (blkidTableType == "gpt") return "GPT_partition_scheme";
  if (blkidTableType == "dos") return "MBR_partition_scheme";
  if (blkidTableType.empty()) return "";
  return blkidTableType + "_partition_scheme";
}

std::string PartitionContent(const char* gptTypeGuid, int mbrType) {
  if (gptTypeGuid && *gptTypeGuid) {
    std::string guid(gptTypeGuid);
    for (char& c : guid) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    return guid;
  }
  char text[8];
  std::snprintf(text, sizeof text, "0x%02X", mbrType & 0xff);
  return text;
}

std::optional<PartitionTable> ProbePartitionTable(const std::string& node) {
  CHandle<blkid_struct_probe, blkid_free_probe> probe(
      blkid_new_probe_from_filename(node.c_str()));
  if (!probe) return std::nullopt;
  PartitionTable table;
  blkid_partlist partitions = blkid_probe_get_partitions(probe.get());
  if (!partitions) return table;  // no partition table (or none libblkid knows)
  if (blkid_parttable root = blkid_partlist_get_table(partitions)) {
    const char* type = blkid_parttable_get_type(root);
    table.scheme = SchemeContent(type ? type : "");
  }
  int count = blkid_partlist_numof_partitions(partitions);
  for (int i = 0; i < count; ++i) {
    blkid_partition partition = blkid_partlist_get_partition(partitions, i);
    if (!partition) continue;
    table.contentByNumber[blkid_partition_get_partno(partition)] = PartitionContent(
        blkid_partition_get_type_string(partition), blkid_partition_get_type(partition));
  }
  return table;
}

std::optional<std::string> ReadLoopIdentifier(const std::string& node) {
  Fd fd(open(node.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  std::string text;
  if (fd.get() < 0 || loop::ReadIdentifier(fd.get(), text) < 0 || !formats::IsUuidText(text)) {
    return std::nullopt;
  }
  return text;
}

bool EnsureBlockNode(const std::string& path, dev_t number) {
  struct stat existing;
  if (lstat(path.c_str(), &existing) == 0 || errno != ENOENT) return false;
  if (mknod(path.c_str(), S_IFBLK | 0660, number) != 0) {
    Log(Level::Default, "Failed to create device node %s: %{errno}d", path, errno);
    return false;
  }
  return true;
}

void RemoveBlockNode(const std::string& path, dev_t number) {
  struct stat existing;
  if (lstat(path.c_str(), &existing) != 0) return;
  if (S_ISBLK(existing.st_mode) && existing.st_rdev == number) unlink(path.c_str());
}

}  // namespace brisvale::registry::sysfs
