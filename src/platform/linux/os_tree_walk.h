// The tree walk behind the start-up clean-up and the sandbox teardown. It moves through
// the tree by directory handles only, so whatever it reports can be acted on relative
// to the directory that holds it (unlinkat, never a path resolved again):
// - a directory is entered by opening its name in its parent without following a
//   link; one swapped for a link meanwhile is reported as the link it now is;
// - a directory on another mount (a different mount ID, which also tells a bind mount
//   of the same file system apart, or a mount root) is reported but never entered;
// - the start path must not pass through any link, its last component included;
// - an explicit stack replaces recursion, and only the deepest levels keep their
//   directories open: a shallower one is opened again through ".." and must be the
//   very directory it was, so no depth or path length limits the walk.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "platform/os.h"

namespace brisvale::os {

// What the walk needs of a file system. Handles are small non-negative integers (file
// descriptors on Linux); failures answer -errno.
class DirectoryAccess {
 public:
  struct Identity {
    uint64_t device = 0;
    uint64_t inode = 0;
    uint64_t mountId = 0;
    bool mountRoot = false;
    bool operator==(const Identity&) const = default;
  };
  virtual ~DirectoryAccess() = default;
  // Opens the directory at `path`, refusing a link in any component.
  virtual int OpenPath(const char* path) = 0;
  // Opens `name` in `dir` as a directory; a link is refused, never followed.
  virtual int OpenChild(int dir, const char* name) = 0;
  virtual int OpenParent(int dir) = 0;
  virtual void Close(int handle) = 0;
  virtual int IdentityOf(int dir, Identity& identity) = 0;
  // The names in `dir`, "." and ".." left out.
  virtual int List(int dir, std::vector<std::string>& names) = 0;
  // What `name` in `dir` is, not following a link: one of the k* types, or -errno.
  static constexpr int kOther = 0, kDirectory = 1, kLink = 2;
  virtual int TypeOf(int dir, const char* name) = 0;
};

// Walks `root` and everything below it, each directory reported before and after its
// contents, every node with the handle of the directory that holds it. The visitor
// answers false to stop the walk.
TreeWalk WalkTreeWith(DirectoryAccess& access, const char* root,
                      const std::function<bool(const TreeNode&)>& visit);

// The same over the real file system.
TreeWalk WalkDirectoryTree(const char* root, const std::function<bool(const TreeNode&)>& visit);

// For tests: called with a directory's path after it was examined and before it is
// opened, the moment a racing user would swap it for a link. Empty to remove.
void SetTreeWalkHookForTesting(std::function<void(const std::string& path)> hook);

}  // namespace brisvale::os
