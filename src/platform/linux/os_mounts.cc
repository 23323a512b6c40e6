#include <libmount/libmount.h>

#include <cerrno>
#include <memory>

#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

struct TableDeleter {
  void operator()(libmnt_table* table) const { mnt_unref_table(table); }
};
struct IterDeleter {
  void operator()(libmnt_iter* iter) const { mnt_free_iter(iter); }
};

bool HasOption(const char* options, const char* name) {
  char* value = nullptr;
  size_t size = 0;
  return options && mnt_optstr_get_option(options, name, &value, &size) == 0;
}

std::string Text(const char* text) { return text ? std::string(text) : std::string(); }

}  // namespace

int ReadMountTable(const char* path, std::span<MountRecord> records) {
  std::unique_ptr<libmnt_table, TableDeleter> table(mnt_new_table());
  std::unique_ptr<libmnt_iter, IterDeleter> iter(mnt_new_iter(MNT_ITER_FORWARD));
  if (!table || !iter) return -ENOMEM;
  // The parser decodes the table's octal escapes (a space is written \040).
  if (int rc = mnt_table_parse_file(table.get(), path); rc != 0) return rc < 0 ? rc : -EINVAL;
  if (records.empty()) return mnt_table_get_nents(table.get());

  size_t filled = 0;
  libmnt_fs* fs = nullptr;
  while (filled < records.size() && mnt_table_next_fs(table.get(), iter.get(), &fs) == 0) {
    MountRecord& record = records[filled++];
    record.flags = 0;
    // Read-only either for this mount or for the whole file system.
    if (HasOption(mnt_fs_get_vfs_options(fs), "ro") || HasOption(mnt_fs_get_fs_options(fs), "ro")) {
      record.flags |= kMountReadOnly;
    }
    record.typeName = Text(mnt_fs_get_fstype(fs));
    record.mountedOn = Text(mnt_fs_get_target(fs));
    record.mountedFrom = Text(mnt_fs_get_source(fs));
  }
  return static_cast<int>(filled);
}

int LinuxOs::GetMountTable(std::span<MountRecord> records) {
  return ReadMountTable("/proc/self/mountinfo", records);
}

}  // namespace brisvale::os
