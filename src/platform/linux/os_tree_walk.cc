#include "platform/linux/os_tree_walk.h"

#include <cerrno>
#include <string_view>
#include <utility>

namespace brisvale::os {
namespace {

// Directories the walk keeps open at once; deeper trees reopen shallower levels.
constexpr size_t kOpenLevels = 64;

std::function<void(const std::string&)>& Hook() {
  static std::function<void(const std::string&)> hook;
  return hook;
}

// A handle of `access`, closed by its owner.
class Handle {
 public:
  Handle() = default;
  Handle(DirectoryAccess& access, int handle) : access_(&access), handle_(handle) {}
  Handle(Handle&& other) noexcept
      : access_(other.access_), handle_(std::exchange(other.handle_, -1)) {}
  Handle& operator=(Handle&& other) noexcept {
    if (this != &other) {
      Reset();
      access_ = other.access_;
      handle_ = std::exchange(other.handle_, -1);
    }
    return *this;
  }
  ~Handle() { Reset(); }
  int get() const { return handle_; }
  explicit operator bool() const { return handle_ >= 0; }
  void Reset() {
    if (handle_ >= 0) access_->Close(handle_);
    handle_ = -1;
  }

 private:
  DirectoryAccess* access_ = nullptr;
  int handle_ = -1;
};

// One directory being walked.
struct Level {
  Handle dir;  // empty while closed to save handles; reopened through ".."
  DirectoryAccess::Identity identity;
  std::string name;
  std::vector<std::string> entries;
  size_t next = 0;
  size_t pathLength = 0;
};

class Walk {
 public:
  Walk(DirectoryAccess& access, const std::function<bool(const TreeNode&)>& visit)
      : access_(access), visit_(visit) {}

  TreeWalk Run(const char* root) {
    TreeWalk result;
    path_ = root;
    const std::string_view rootPath = path_;
    const size_t slash = rootPath.find_last_of('/');
    std::string parentPath = slash == std::string_view::npos ? "." : std::string(rootPath.substr(0, slash));
    if (parentPath.empty()) parentPath = "/";
    const std::string name(slash == std::string_view::npos ? rootPath : rootPath.substr(slash + 1));
    if (name.empty() || name == "." || name == "..") {
      result.openError = -EINVAL;
      return result;
    }
    Handle parent = Open(access_.OpenPath(parentPath.c_str()));
    if (!parent) {
      result.openError = lastError_;
      return result;
    }
    Handle start = Open(access_.OpenChild(parent.get(), name.c_str()));
    if (!start) {
      const int type = access_.TypeOf(parent.get(), name.c_str());
      if (type == DirectoryAccess::kLink) {
        result.openError = -ELOOP;  // the start itself is a link: not followed, not removed
      } else if (type == DirectoryAccess::kOther) {
        Report(TreeNode::Kind::NonDirectory, 0, name, parent.get());
      } else {
        Report(TreeNode::Kind::Other, 0, name, parent.get());
      }
      return result;
    }
    Level first;
    first.dir = std::move(start);
    first.name = name;
    first.pathLength = path_.size();
    if (access_.IdentityOf(first.dir.get(), first.identity) < 0 ||
        access_.List(first.dir.get(), first.entries) < 0) {
      Report(TreeNode::Kind::Other, 0, name, parent.get());
      return result;
    }
    if (!Report(TreeNode::Kind::DirectoryPreorder, 0, name, parent.get())) return result;
    levels_.push_back(std::move(first));
    while (!levels_.empty()) {
      if (!Step(parent.get(), result)) break;
    }
    return result;
  }

 private:
  Handle Open(int rc) {
    if (rc < 0) {
      lastError_ = rc;
      return {};
    }
    return Handle(access_, rc);
  }

  bool Report(TreeNode::Kind kind, int level, const std::string& name, int directory, bool mountPoint = false) {
    TreeNode node{kind, path_, level, mountPoint, name, directory};
    return visit_(node);
  }

  // Visits the next entry of the deepest level, or finishes that level. False ends the walk.
  bool Step(int startParent, TreeWalk& result) {
    Level& current = levels_.back();
    const int level = static_cast<int>(levels_.size());
    if (current.next == current.entries.size()) return Finish(startParent, result);
    const std::string name = current.entries[current.next++];
    path_.resize(current.pathLength);
    path_ += '/';
    path_ += name;
    const int type = access_.TypeOf(current.dir.get(), name.c_str());
    if (type < 0) return Report(TreeNode::Kind::Other, level, name, current.dir.get());
    if (type != DirectoryAccess::kDirectory) return Report(TreeNode::Kind::NonDirectory, level, name, current.dir.get());
    if (Hook()) Hook()(path_);
    Handle child = Open(access_.OpenChild(current.dir.get(), name.c_str()));
    if (!child) {
      // Replaced by a link or a file since it was examined: that is what gets removed.
      const bool replaced = lastError_ == -ELOOP || lastError_ == -ENOTDIR;
      return Report(replaced ? TreeNode::Kind::NonDirectory : TreeNode::Kind::Other, level, name, current.dir.get());
    }
    Level next;
    next.name = name;
    next.pathLength = path_.size();
    if (access_.IdentityOf(child.get(), next.identity) < 0) {
      return Report(TreeNode::Kind::Other, level, name, current.dir.get());
    }
    if (next.identity.mountRoot || next.identity.mountId != current.identity.mountId ||
        next.identity.device != current.identity.device) {
      // Another mount: reported so its covered directory fails to go, never entered.
      child.Reset();
      return Report(TreeNode::Kind::DirectoryPreorder, level, name, current.dir.get(), true) &&
             Report(TreeNode::Kind::DirectoryPostorder, level, name, current.dir.get(), true);
    }
    if (access_.List(child.get(), next.entries) < 0) {
      return Report(TreeNode::Kind::Other, level, name, current.dir.get());
    }
    if (!Report(TreeNode::Kind::DirectoryPreorder, level, name, current.dir.get())) return false;
    next.dir = std::move(child);
    if (levels_.size() >= kOpenLevels) levels_[levels_.size() - kOpenLevels].dir.Reset();
    levels_.push_back(std::move(next));
    return true;
  }

  // The deepest level is done: report it after its contents from its parent.
  bool Finish(int startParent, TreeWalk& result) {
    Level done = std::move(levels_.back());
    levels_.pop_back();
    path_.resize(done.pathLength);
    const int level = static_cast<int>(levels_.size());
    if (levels_.empty()) return Report(TreeNode::Kind::DirectoryPostorder, 0, done.name, startParent);
    Level& parent = levels_.back();
    if (!parent.dir) {
      // The parent must be the directory it was: a tree moved meanwhile is not followed.
      Handle reopened = Open(access_.OpenParent(done.dir.get()));
      DirectoryAccess::Identity identity;
      if (!reopened || access_.IdentityOf(reopened.get(), identity) < 0 || !(identity == parent.identity)) {
        result.closeError = -ESTALE;
        return false;
      }
      parent.dir = std::move(reopened);
    }
    return Report(TreeNode::Kind::DirectoryPostorder, level, done.name, parent.dir.get());
  }

  DirectoryAccess& access_;
  const std::function<bool(const TreeNode&)>& visit_;
  std::vector<Level> levels_;
  std::string path_;
  int lastError_ = 0;
};

}  // namespace

TreeWalk WalkTreeWith(DirectoryAccess& access, const char* root,
                      const std::function<bool(const TreeNode&)>& visit) {
  return Walk(access, visit).Run(root);
}

void SetTreeWalkHookForTesting(std::function<void(const std::string& path)> hook) { Hook() = std::move(hook); }

}  // namespace brisvale::os
