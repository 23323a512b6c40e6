#include <libmount/libmount.h>

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <memory>
#include <set>
#include <vector>

#include "base/c_handle.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

bool HasOption(const char* options, const char* name) {
  char* value = nullptr;
  size_t size = 0;
  return options && mnt_optstr_get_option(options, name, &value, &size) == 0;
}

std::string Text(const char* text) { return text ? std::string(text) : std::string(); }

struct FileCloser {
  void operator()(FILE* stream) const { std::fclose(stream); }
};

// Calls `visit` with each file system of the table in the kernel's mountinfo format in
// `stream`; the count of them, or a negative error.
template <typename Visit>
int ForEachMount(FILE* stream, Visit visit) {
  CHandle<libmnt_table, mnt_unref_table> table(mnt_new_table());
  CHandle<libmnt_iter, mnt_free_iter> iter(mnt_new_iter(MNT_ITER_FORWARD));
  if (!table || !iter) return -ENOMEM;
  // The parser decodes the table's octal escapes (a space is written \040).
  if (int rc = mnt_table_parse_stream(table.get(), stream, "mountinfo"); rc != 0) return rc < 0 ? rc : -EINVAL;
  int count = 0;
  libmnt_fs* fs = nullptr;
  while (mnt_table_next_fs(table.get(), iter.get(), &fs) == 0) {
    visit(fs);
    ++count;
  }
  return count;
}

int ParseMountTable(FILE* stream, std::vector<MountRecord>& records) {
  records.clear();
  return ForEachMount(stream, [&records](libmnt_fs* fs) {
    MountRecord record;
    // Read-only either for this mount or for the whole file system.
    if (HasOption(mnt_fs_get_vfs_options(fs), "ro") || HasOption(mnt_fs_get_fs_options(fs), "ro")) {
      record.flags |= kMountReadOnly;
    }
    record.typeName = Text(mnt_fs_get_fstype(fs));
    record.mountedOn = Text(mnt_fs_get_target(fs));
    record.mountedFrom = Text(mnt_fs_get_source(fs));
    records.push_back(std::move(record));
  });
}

// The daemon sees the table through fixed-size fields: paths of at most 1023 bytes and
// type names of at most 15, cut like the platform's own table cuts them.
constexpr size_t kMaxPathLength = 1023;
constexpr size_t kMaxTypeNameLength = 15;

MountRecord Cut(const MountRecord& record) {
  MountRecord cut = record;
  if (cut.typeName.size() > kMaxTypeNameLength) cut.typeName.resize(kMaxTypeNameLength);
  if (cut.mountedOn.size() > kMaxPathLength) cut.mountedOn.resize(kMaxPathLength);
  if (cut.mountedFrom.size() > kMaxPathLength) cut.mountedFrom.resize(kMaxPathLength);
  return cut;
}

int CountOrFill(const std::vector<MountRecord>& table, std::span<MountRecord> records) {
  if (records.empty()) return static_cast<int>(table.size());
  const size_t filled = std::min(records.size(), table.size());
  std::transform(table.begin(), table.begin() + static_cast<std::ptrdiff_t>(filled), records.begin(), Cut);
  return static_cast<int>(filled);
}

}  // namespace

int ReadWholeMountTable(const char* path, std::vector<MountRecord>& records) {
  std::unique_ptr<FILE, FileCloser> stream(std::fopen(path, "re"));
  if (!stream) return -errno;
  return ParseMountTable(stream.get(), records);
}

int ReadMountedDevices(const char* path, std::set<dev_t>& devices) {
  std::unique_ptr<FILE, FileCloser> stream(std::fopen(path, "re"));
  if (!stream) return -errno;
  devices.clear();
  return ForEachMount(stream.get(), [&devices](libmnt_fs* fs) { devices.insert(mnt_fs_get_devno(fs)); });
}

int ReadMountTable(const char* path, std::span<MountRecord> records) {
  std::vector<MountRecord> table;
  if (int rc = ReadWholeMountTable(path, table); rc < 0) return rc;
  return CountOrFill(table, records);
}

// The count and the fill of one listing come a moment apart. The kernel flags the
// mountinfo descriptor when the table changes (POLLPRI), so the fill reuses the table
// the count parsed unless a mount or unmount came in between; the table is read and
// parsed once per listing instead of twice.
int LinuxOs::GetMountTable(std::span<MountRecord> records) {
  if (!mountInfo_) {
    mountInfo_.Reset(::open("/proc/self/mountinfo", O_RDONLY | O_CLOEXEC));
    if (!mountInfo_) return -errno;
  }
  pollfd changed{mountInfo_.get(), POLLPRI, 0};
  const bool tableChanged = ::poll(&changed, 1, 0) != 0;  // an error counts as a change
  const bool reuse = !records.empty() && countedTable_ && !tableChanged;
  if (!reuse) {
    if (::lseek(mountInfo_.get(), 0, SEEK_SET) < 0) return -errno;
    // The descriptor stays ours: the stream reads through a duplicate.
    const int duplicate = ::dup(mountInfo_.get());
    if (duplicate < 0) return -errno;
    std::unique_ptr<FILE, FileCloser> stream(::fdopen(duplicate, "r"));
    if (!stream) {
      ::close(duplicate);
      return -ENOMEM;
    }
    if (int rc = ParseMountTable(stream.get(), table_); rc < 0) return rc;
  }
  // Only a count is remembered for the fill that follows it.
  countedTable_ = records.empty();
  return CountOrFill(table_, records);
}

}  // namespace brisvale::os
