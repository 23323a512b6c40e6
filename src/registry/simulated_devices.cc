#include "registry/simulated_devices.h"

#include <fstream>
#include <iterator>
#include <set>

#include "base/log.h"

namespace brisvale::registry {
namespace {

constexpr size_t kMaxFileBytes = 16 << 20;

struct Wanted {
  std::vector<std::string> path;
  std::vector<std::string> chain;  // most derived first
  plist::Dictionary properties;
};

std::string PathText(const std::vector<std::string>& path) {
  std::string text;
  for (const auto& name : path) text += "/" + name;
  return text.empty() ? "/" : text;
}

std::optional<plist::Value> ReadFile(const std::string& path, std::string* error) {
  std::ifstream file(path, std::ios::binary);
  if (!file) {
    *error = "cannot open the file";
    return std::nullopt;
  }
  plist::Bytes bytes;
  char buffer[65536];
  while (file.read(buffer, sizeof buffer) || file.gcount() > 0) {
    bytes.insert(bytes.end(), buffer, buffer + file.gcount());
    if (bytes.size() > kMaxFileBytes) {
      *error = "the file is larger than 16 MiB";
      return std::nullopt;
    }
  }
  if (file.bad()) {
    *error = "cannot read the file";
    return std::nullopt;
  }
  return plist::Read(bytes, error);
}

// Flattens the tree, parents before children, checking every object on the way.
bool Collect(const plist::Array& objects, const std::vector<std::string>& parentPath,
             std::vector<Wanted>& out, std::string* error) {
  std::set<std::string> siblings;
  for (size_t index = 0; index < objects.size(); ++index) {
    const plist::Value& entry = objects[index];
    std::vector<std::string> path = parentPath;
    auto fail = [&](const std::string& why) {
      *error = "object " + PathText(path) + ": " + why;
      return false;
    };
    if (!entry.dictionary()) {
      path.push_back("#" + std::to_string(index));
      return fail("is not a dictionary");
    }
    const plist::Value* name = entry.get("Name");
    if (name && (!name->string() || name->string()->empty())) {
      path.push_back("#" + std::to_string(index));
      return fail("\"Name\" is not a non-empty string");
    }
    path.push_back(name ? *name->string() : "#" + std::to_string(index));
    if (!siblings.insert(path.back()).second) return fail("has a duplicate name");

    Wanted wanted{path, {}, {}};
    const plist::Value* cls = entry.get("Class");
    if (cls && cls->string()) {
      wanted.chain.push_back(*cls->string());
    } else if (cls && cls->array()) {
      for (const auto& element : *cls->array()) {
        if (!element.string()) return fail("\"Class\" holds a value that is not a string");
        wanted.chain.push_back(*element.string());
      }
    }
    if (wanted.chain.empty()) return fail("has no \"Class\"");
    for (const auto& className : wanted.chain) {
      if (className.empty()) return fail("has an empty class name");
    }
    if (const plist::Value* properties = entry.get("Properties")) {
      if (!properties->dictionary()) return fail("\"Properties\" is not a dictionary");
      wanted.properties = *properties->dictionary();
    }
    out.push_back(std::move(wanted));
    if (const plist::Value* children = entry.get("Children")) {
      if (!children->array()) return fail("\"Children\" is not an array");
      if (!Collect(*children->array(), path, out, error)) return false;
    }
  }
  return true;
}

}  // namespace

SimulatedDevices::SimulatedDevices(RegistryModel& model, std::string path)
    : model_(model), path_(std::move(path)) {
  model_.AddProvider(this);
}

SimulatedDevices::~SimulatedDevices() {
  model_.RemoveProvider(this);
  for (const auto& [path, published] : objects_) model_.Terminate(published.object);
}

void SimulatedDevices::Refresh(RefreshReason reason) {
  if (reason == RefreshReason::HardwareEvent) Reload();
}

bool SimulatedDevices::Reload(std::string* errorOut) {
  std::string error;
  std::vector<Wanted> wanted;
  auto root = ReadFile(path_, &error);
  bool usable = false;
  if (root) {
    const plist::Value* objects = root->get("Objects");
    if (!root->dictionary()) {
      error = "the top level is not a dictionary";
    } else if (!objects || !objects->array()) {
      error = "\"Objects\" is missing or not an array";
    } else {
      usable = Collect(*objects->array(), {}, wanted, &error);
    }
  }
  // A chain that contradicts a class the registry already knows makes the file unusable.
  for (size_t i = 0; usable && i < wanted.size(); ++i) {
    const auto& chain = wanted[i].chain;
    for (size_t c = 0; c + 1 < chain.size(); ++c) {
      if (!model_.DefineClass(chain[c], chain[c + 1])) {
        error = "object " + PathText(wanted[i].path) + ": class " + chain[c] +
                " does not derive from " + chain[c + 1];
        usable = false;
        break;
      }
    }
  }
  if (!usable) {
    Log(Level::Default, "Failed to read devices file %s: %s", path_, error);
    if (errorOut) *errorOut = error;
    return false;
  }

  std::map<std::vector<std::string>, const Wanted*> byPath;
  for (const auto& entry : wanted) byPath.emplace(entry.path, &entry);

  // Gone, or changed class or parent: out of the registry (with their subtrees).
  for (const auto& [path, published] : objects_) {
    auto it = byPath.find(path);
    if (it == byPath.end() || it->second->chain.front() != published.object->ClassName()) {
      model_.Terminate(published.object);
    }
  }
  std::erase_if(objects_, [](const auto& item) { return item.second.object->IsTerminated(); });

  for (const auto& entry : wanted) {
    auto existing = objects_.find(entry.path);
    if (existing != objects_.end()) {
      auto current = existing->second.object->CopyProperties();
      if (!(current.value == plist::Value(entry.properties))) {
        model_.SetProperties(existing->second.object, entry.properties);
      }
      continue;
    }
    ObjectRef parent;
    if (entry.path.size() > 1) {
      std::vector<std::string> parentPath(entry.path.begin(), entry.path.end() - 1);
      parent = objects_.at(parentPath).object;
    }
    ObjectRef object = model_.Publish(parent, entry.chain.front(), entry.properties);
    objects_[entry.path] = Published{object, entry.chain};
  }
  return true;
}

ObjectRef SimulatedDevices::Find(const std::vector<std::string>& path) const {
  auto it = objects_.find(path);
  return it == objects_.end() ? nullptr : it->second.object;
}

}  // namespace brisvale::registry
