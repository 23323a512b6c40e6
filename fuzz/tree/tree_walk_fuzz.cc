// The clean-up's tree walk over a made-up file system: the input builds a tree of
// directories, files, links and mounts below /start beside an /outside tree, and picks
// the moment a directory is swapped for a link to /outside. Removing what the walk
// reports, as the clean-up does, must never touch anything outside /start or inside a
// mount, and the walk must end.
#include <cerrno>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "platform/linux/os_tree_walk.h"

using namespace brisvale::os;

namespace {

struct Node {
  enum Kind { Directory, File, Link } kind = Directory;
  int parent = -1;
  std::string name;
  std::map<std::string, int> children;
  uint64_t mount = 1;
  bool mountRoot = false;
  bool protectedNode = false;  // outside /start or on another mount: must survive
  bool removed = false;
};

class FakeTree final : public DirectoryAccess {
 public:
  std::vector<Node> nodes;
  int swapAtOpen = -1;  // the OpenChild call that finds its directory swapped

  int Add(int parent, Node::Kind kind, const std::string& name, bool mountRoot = false) {
    if (nodes[parent].kind != Node::Directory || nodes[parent].children.count(name)) return -1;
    Node node;
    node.kind = kind;
    node.parent = parent;
    node.name = name;
    node.mountRoot = mountRoot;
    node.mount = mountRoot ? nodes.size() + 100 : nodes[parent].mount;
    node.protectedNode = nodes[parent].protectedNode || mountRoot;
    nodes.push_back(node);
    const int id = static_cast<int>(nodes.size() - 1);
    nodes[parent].children[name] = id;
    return id;
  }

  int OpenPath(const char* path) override { return std::string(path) == "/" ? Handle(0) : -ENOENT; }
  int OpenChild(int dir, const char* name) override {
    const int child = Child(dir, name);
    if (child < 0) return child;
    if (opens_++ == swapAtOpen && nodes[child].kind == Node::Directory && !nodes[child].mountRoot) {
      // A user moves the directory away and leaves a link to /outside in its place.
      nodes[nodes[child].parent].children.erase(name);
      const int link = Add(nodes[child].parent, Node::Link, name);
      return link < 0 ? -ENOENT : -ELOOP;
    }
    if (nodes[child].kind == Node::Link) return -ELOOP;
    if (nodes[child].kind == Node::File) return -ENOTDIR;
    return Handle(child);
  }
  int OpenParent(int dir) override {
    const int parent = nodes[handles_.at(dir)].parent;
    return parent < 0 ? -ENOENT : Handle(parent);
  }
  void Close(int handle) override { handles_.erase(handle); }
  int IdentityOf(int dir, Identity& identity) override {
    const int node = handles_.at(dir);
    identity = {1, static_cast<uint64_t>(node), nodes[node].mount, nodes[node].mountRoot};
    return 0;
  }
  int List(int dir, std::vector<std::string>& names) override {
    names.clear();
    for (const auto& [name, child] : nodes[handles_.at(dir)].children) names.push_back(name);
    return 0;
  }
  int TypeOf(int dir, const char* name) override {
    const int child = Child(dir, name);
    if (child < 0) return child;
    return nodes[child].kind == Node::Directory ? kDirectory : nodes[child].kind == Node::Link ? kLink : kOther;
  }

  // The clean-up's removals, relative to the directory handle.
  int Remove(int dir, const std::string& name, bool directory) {
    const int child = Child(dir, name.c_str());
    if (child < 0) return child;
    Node& node = nodes[child];
    if (directory != (node.kind == Node::Directory)) return directory ? -ENOTDIR : -EISDIR;
    if (node.mountRoot) return -EBUSY;
    if (!node.children.empty()) return -ENOTEMPTY;
    if (node.protectedNode) std::abort();  // reached something it must not
    node.removed = true;
    nodes[node.parent].children.erase(name);
    return 0;
  }

  size_t OpenHandles() const { return handles_.size(); }

 private:
  int Handle(int node) {
    handles_[next_] = node;
    return next_++;
  }
  int Child(int dir, const char* name) {
    const auto handle = handles_.find(dir);
    if (handle == handles_.end()) std::abort();  // a handle used after its close
    const auto& children = nodes[handle->second].children;
    const auto found = children.find(name);
    return found == children.end() ? -ENOENT : found->second;
  }
  std::map<int, int> handles_;
  int next_ = 0;
  int opens_ = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1 || size > 4096) return 0;
  FakeTree tree;
  tree.nodes.push_back(Node{});  // "/"
  const int outside = tree.Add(0, Node::Directory, "outside");
  tree.nodes[outside].protectedNode = true;
  tree.Add(outside, Node::File, "precious");
  tree.nodes.back().protectedNode = true;
  const int start = tree.Add(0, Node::Directory, "start");
  tree.swapAtOpen = data[0] % 16 - 1;
  std::vector<int> directories{start};
  // Two bytes per node: its parent among the directories so far and its kind and name.
  for (size_t i = 1; i + 1 < size; i += 2) {
    const int parent = directories[data[i] % directories.size()];
    const uint8_t shape = data[i + 1];
    const std::string name(1, static_cast<char>('a' + shape % 8));
    const int kind = (shape >> 3) % 4;
    const int id = tree.Add(parent, kind == 1 ? Node::File : kind == 2 ? Node::Link : Node::Directory, name, kind == 3);
    if (id >= 0 && tree.nodes[id].kind == Node::Directory) directories.push_back(id);
  }

  const TreeWalk walk = WalkTreeWith(tree, "/start", [&](const TreeNode& node) {
    if (node.path.rfind("/start", 0) != 0) std::abort();
    if (node.kind == TreeNode::Kind::NonDirectory) return tree.Remove(node.directory, node.name, false) == 0;
    if (node.kind == TreeNode::Kind::DirectoryPostorder) {
      const int rc = tree.Remove(node.directory, node.name, true);
      return rc == 0 || (node.mountPoint && rc == -EBUSY);
    }
    return true;
  });
  // A start swapped for a link is refused, never walked.
  if ((walk.openError != 0 && walk.openError != -ELOOP) || tree.OpenHandles() != 0) std::abort();
  return 0;
}
