// Tearing a sandbox root down: unmount everything below it, detach the loop devices
// its files back, and remove the tree with the clean-up's walk, which never follows a
// link and never enters a mount.
#include <fcntl.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>

#include <fstream>
#include <utility>

#include "base/unique_fd.h"
#include "platform/linux/os_sandbox.h"
#include "platform/linux/os_sandbox_internal.h"
#include "platform/linux/os_tree_walk.h"

namespace brisvale::linux_os {
namespace {

using namespace sandbox;
using Fd = UniqueFd;

size_t Depth(const std::string& path) { return static_cast<size_t>(std::count(path.begin(), path.end(), '/')); }

bool UnmountAllBelow(const std::string& root, std::string* error) {
  // Rounds, because a mount hidden under another only shows up once that one is gone.
  for (int round = 0; round < 64; ++round) {
    std::vector<std::pair<size_t, std::string>> below;  // (order in table, mount point)
    const std::vector<os::MountRecord> table = CurrentMounts();
    for (size_t i = 0; i < table.size(); ++i) {
      if (IsAtOrBelow(table[i].mountedOn, root)) below.emplace_back(i, table[i].mountedOn);
    }
    if (below.empty()) return true;
    // Deepest first; on one path the latest mount first.
    std::sort(below.begin(), below.end(), [](const auto& a, const auto& b) {
      size_t da = Depth(a.second), db = Depth(b.second);
      return da != db ? da > db : a.first > b.first;
    });
    for (const auto& [order, path] : below) {
      if (::umount2(path.c_str(), UMOUNT_NOFOLLOW) == 0) continue;
      if (errno == EINVAL || errno == ENOENT) continue;  // already gone with its parent
      if (::umount2(path.c_str(), UMOUNT_NOFOLLOW | MNT_DETACH) != 0 && errno != EINVAL) {
        return Fail(error, SystemError("cannot unmount " + path, errno));
      }
    }
  }
  return Fail(error, "mounts below " + root + " keep coming back");
}

std::optional<std::string> ReadFirstLine(const std::string& path) {
  std::ifstream in(path);
  std::string line;
  if (!in || !std::getline(in, line)) return std::nullopt;
  return line;
}

// Loop devices whose backing file lies in root. A busy one (still mounted) is only
// marked to detach itself when its last user goes, which the unmounts then bring about.
bool DetachLoopsBackedBelow(const std::string& root, std::string* error) {
  DirHandle blocks(::opendir("/sys/block"));
  if (!blocks) return true;
  bool ok = true;
  while (dirent* entry = ::readdir(blocks.get())) {
    std::string name = entry->d_name;
    if (!IsLoopName(name)) continue;
    auto backing = ReadFirstLine("/sys/block/" + name + "/loop/backing_file");
    if (!backing) continue;
    constexpr std::string_view kDeleted = " (deleted)";
    if (backing->ends_with(kDeleted)) backing->resize(backing->size() - kDeleted.size());
    if (!IsAtOrBelow(*backing, root)) continue;
    Fd device(::open(("/dev/" + name).c_str(), O_RDONLY | O_CLOEXEC));
    if (!device) device = Fd(::open((root + "/dev/" + name).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!device || (::ioctl(device.get(), LOOP_CLR_FD, 0) != 0 && errno != ENXIO)) {
      ok = Fail(error, SystemError("cannot detach /dev/" + name + " (backed by " + *backing + ")", errno));
    }
  }
  return ok;
}

// Collects what could not be removed; the walk goes on past each.
struct RemovalState {
  std::string firstError;
  int failures = 0;
  void Note(std::string message) {
    if (failures++ == 0) firstError = std::move(message);
  }
};

bool RemoveTree(const std::string& root, std::string* error) {
  RemovalState state;
  const os::TreeWalk walk = os::WalkDirectoryTree(root.c_str(), [&](const os::TreeNode& node) {
    using Kind = os::TreeNode::Kind;
    if (node.kind == Kind::Other) {
      state.Note("cannot read " + node.path);
    } else if (node.kind == Kind::NonDirectory) {
      if (::unlinkat(node.directory, node.name.c_str(), 0) != 0) state.Note(SystemError("cannot remove " + node.path, errno));
    } else if (node.kind == Kind::DirectoryPostorder) {
      if (node.mountPoint) {
        state.Note(node.path + " is a mount point; left in place");
      } else if (::unlinkat(node.directory, node.name.c_str(), AT_REMOVEDIR) != 0) {
        state.Note(SystemError("cannot remove " + node.path, errno));
      }
    }
    return true;
  });
  if (walk.openError) return Fail(error, SystemError("cannot open " + root, -walk.openError));
  if (walk.closeError) state.Note(root + " changed while it was removed");
  if (state.failures == 0) return true;
  std::string message = state.firstError;
  if (state.failures > 1) message += " (and " + std::to_string(state.failures - 1) + " more)";
  return Fail(error, message);
}

}  // namespace

bool TeardownSandboxRoot(const std::string& dir, std::string* error) {
  auto resolved = ResolveSandboxDir(dir, true, error);
  if (!resolved) return false;
  if (!resolved->exists) return true;
  const std::string& root = resolved->path;
  if (!HasCapabilities({CAP_SYS_ADMIN})) {
    return Fail(error, "tearing down the sandbox root " + root + " needs root (CAP_SYS_ADMIN)");
  }
  std::string marker = root + "/" + kSandboxMarker;
  struct stat st {};
  if (::lstat(marker.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    return Fail(error, root + " is not a sandbox root (it has no " + kSandboxMarker + "); left alone");
  }
  // Loops first, while their backing paths can still be read; busy ones detach
  // themselves as the unmounts release them.
  std::string loopError;
  bool loopsOk = DetachLoopsBackedBelow(root, &loopError);
  if (!UnmountAllBelow(root, error)) return false;
  if (!loopsOk && !DetachLoopsBackedBelow(root, error)) return false;
  return RemoveTree(root, error);
}

}  // namespace brisvale::linux_os
