#include "daemon/stale_mount_points.h"

#include <algorithm>
#include <cerrno>
#include <string>
#include <vector>

#include "base/log.h"
#include "base/utf8.h"
#include "inventory/inventory.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

// Every path something is mounted on. The inventory knows only the mounts of devices
// it tracks; this keeps a bind mount or a memory file system placed in a root from
// being emptied too. Empty when the table cannot be read.
std::vector<std::string> MountedPaths(os::Os& os) {
  std::vector<os::MountRecord> records;
  if (const int count = os::CopyMountTable(os, records); count < 0) {
    Log(Level::Default, "Failed to read the mount table: %{errno}d", -count);
    return {};
  }
  std::vector<std::string> paths;
  for (os::MountRecord& record : records) paths.push_back(std::move(record.mountedOn));
  return paths;
}

bool IsMounted(const std::string& path, const std::vector<std::string>& mountedPaths) {
  if (CopyEntryForMountPath(path)) return true;
  return std::find(mountedPaths.begin(), mountedPaths.end(), path) != mountedPaths.end();
}

}  // namespace

int RemoveTree(const char* path, int removeStart) {
  os::Os& os = *CurrentServices().os;
  const std::string start = std::string(path).substr(0, os::kPathBufferSize);
  int result = 0;
  // Every removal names the node relative to the directory the walk holds open, so a
  // directory swapped for a link meanwhile loses the link, never what it points to.
  const os::TreeWalk walk = os.WalkTree(start.c_str(), [&](const os::TreeNode& node) {
    using Kind = os::TreeNode::Kind;
    const char* name = node.name.c_str();
    if (node.kind == Kind::NonDirectory) {
      os.ClearFlagsAt(node.directory, name);
      if (const int rc = os.UnlinkAt(node.directory, name); rc < 0) {
        Log(Level::Default, "Failed to unlink %s: %{errno}d", node.path.c_str(), -rc);
        result = -1;
        return false;
      }
    } else if (node.kind == Kind::DirectoryPreorder && !node.mountPoint) {
      // An immutable or append-only directory refuses to let its entries go, so its
      // flags go before its contents are visited.
      os.ClearFlagsAt(node.directory, name);
    } else if (node.kind == Kind::DirectoryPostorder && (node.level > 0 || removeStart)) {
      // A mount point inside the tree was not descended into and its flags belong to
      // the other file system: it is left untouched, and removing its still covered
      // directory fails and is logged.
      if (!node.mountPoint) os.ClearFlagsAt(node.directory, name);
      if (const int rc = os.RemoveDirectoryAt(node.directory, name); rc < 0) {
        Log(Level::Default, "Failed to remove %s: %{errno}d", node.path.c_str(), -rc);
        result = -1;
        return false;
      }
    }
    return true;
  });
  if (walk.openError) {
    Log(Level::Default, "Failed to open path(s) for traversal: %{errno}d", -walk.openError);
    return -1;
  }
  if (walk.closeError) {
    Log(Level::Default, "Failed to close directory traversal handle: %{errno}d", -walk.closeError);
    return -1;
  }
  return result;
}

void RemoveStaleMountPoints(const char* mountRoot) {
  os::Os& os = *CurrentServices().os;
  const os::DirectoryListing listing = os.ReadDirectory(mountRoot);
  if (listing.openError < 0) {
    if (listing.openError != -ENOENT) Log(Level::Default, "Failed to open %s: %{errno}d", mountRoot, -listing.openError);
    return;
  }
  const std::vector<os::DirectoryEntry>& entries = listing.entries;
  const std::vector<std::string> mountedPaths = entries.empty() ? std::vector<std::string>() : MountedPaths(os);
  std::string resolvedRoot;
  if (!entries.empty() && os.RealPath(mountRoot, resolvedRoot) < 0) resolvedRoot = mountRoot;
  for (const os::DirectoryEntry& entry : entries) {
    const std::string joined = (std::string(mountRoot) + "/" + entry.name).substr(0, os::kPathBufferSize - 1);
    // A link is removed itself, never resolved: resolving it would aim the removal at
    // whatever it points to, possibly outside the root. Everything else is resolved,
    // because the mount table lists resolved paths ("/var/mnt" is "/private/var/mnt").
    std::string resolved;
    if (entry.isLink || os.RealPath(joined.c_str(), resolved) < 0) resolved = joined;
    // An entry swapped for a link since the root was read resolves somewhere else:
    // that place is not the root's to empty.
    if (!entry.isLink && resolved != joined && resolved != resolvedRoot + "/" + entry.name) {
      Log(Level::Default, "Skipping %s: it resolves to %s.", joined.c_str(), resolved.c_str());
      continue;
    }
    if (!utf8::IsValid(resolved)) {
      Log(Level::Default, "Failed to create string.");  // the inventory holds text only
    } else if (!entry.isLink && IsMounted(resolved, mountedPaths)) {
      Log(Level::Debug, "Skipping destruction of mounted filesystem %s.", resolved.c_str());
      continue;
    }
    Log(Level::Debug, "Attempting destruction of %s.", resolved.c_str());
    if (entry.isDirectory) {
      if (RemoveTree(resolved.c_str(), 1) != 0) Log(Level::Default, "Failed to delete %s.", resolved.c_str());
    } else {
      // A flagged file directly in the root would otherwise refuse to go, as it would
      // deeper down.
      if (!entry.isLink) os.ClearFlags(resolved.c_str());
      if (const int rc = os.Unlink(resolved.c_str()); rc < 0) {
        Log(Level::Default, "Failed to unlink %s: %{errno}d", resolved.c_str(), -rc);
      }
    }
  }
  if (listing.closeError < 0) Log(Level::Default, "Failed to close %s: %{errno}d", mountRoot, -listing.closeError);
}

}  // namespace brisvale
