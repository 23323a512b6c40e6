#include "registry/registry_model.h"

#include <algorithm>
#include <deque>
#include <set>

#include "base/runloop.h"

namespace brisvale::registry {
namespace {

// The queue behind a notification port. Deliveries wait here until the port is
// attached to a loop, then run as main-queue tasks in the order they were queued.
struct PortState : std::enable_shared_from_this<PortState> {
  RunLoop* loop = nullptr;
  bool closed = false;
  bool posted = false;
  std::deque<std::function<void()>> pending;

  void Schedule(std::function<void()> delivery) {
    if (closed) return;
    pending.push_back(std::move(delivery));
    PostIfAttached();
  }

  void PostIfAttached() {
    if (!loop || posted || pending.empty()) return;
    posted = true;
    loop->Post([weak = weak_from_this()] {
      if (auto self = weak.lock()) self->Deliver();
    });
  }

  void Deliver() {
    posted = false;
    // A delivery may close the port (an interest handler tearing its watch down):
    // what is still queued then never runs.
    while (!closed && !pending.empty()) {
      auto delivery = std::move(pending.front());
      pending.pop_front();
      delivery();
    }
  }
};

class ModelPort final : public NotificationPort {
 public:
  ModelPort() : state_(std::make_shared<PortState>()) {}
  ~ModelPort() override {
    state_->closed = true;
    state_->pending.clear();
  }
  void Attach(RunLoop& loop) override {
    state_->loop = &loop;
    state_->PostIfAttached();
  }
  const std::shared_ptr<PortState>& state() const { return state_; }

 private:
  std::shared_ptr<PortState> state_;
};

class SnapshotIterator final : public Iterator {
 public:
  explicit SnapshotIterator(std::vector<ObjectRef> objects) : objects_(std::move(objects)) {}
  ObjectRef Next() override { return next_ < objects_.size() ? objects_[next_++] : nullptr; }
  void Reset() override { next_ = 0; }
  bool IsValid() const override { return true; }

 private:
  std::vector<ObjectRef> objects_;
  size_t next_ = 0;
};

}  // namespace

struct RegistryModel::Node final : Object {
  uint64_t id = 0;
  std::string className;
  std::vector<std::string> chain;
  plist::Value properties{plist::Dictionary{}};
  std::shared_ptr<Node> parent;
  std::vector<std::weak_ptr<Node>> children;
  bool terminated = false;
  UserClientFactory userClients;

  uint64_t EntryId() const override { return id; }
  const std::string& ClassName() const override { return className; }
  bool ConformsTo(std::string_view name) const override {
    return std::find(chain.begin(), chain.end(), name) != chain.end();
  }
  std::optional<plist::Value> Property(std::string_view key) const override {
    if (const plist::Value* value = properties.get(key)) return *value;
    return std::nullopt;
  }
  Result<plist::Value> CopyProperties() const override { return {kSuccess, properties}; }
  Result<ObjectRef> Parent() const override {
    if (terminated || !parent) return {kNoDevice, nullptr};
    return {kSuccess, parent};
  }
  std::vector<ObjectRef> Children() const override {
    std::vector<ObjectRef> live;
    for (const auto& weak : children) {
      auto child = weak.lock();
      if (child && !child->terminated) live.push_back(child);
    }
    return live;
  }
  bool IsTerminated() const override { return terminated; }
};

// One matching notification: the objects waiting in its iterator, and whether the
// iterator has been drained since the last delivery (armed).
struct RegistryModel::MatchWatch : std::enable_shared_from_this<MatchWatch> {
  MatchKind kind;
  Matching matching;
  MatchHandler handler;
  std::weak_ptr<PortState> port;
  std::deque<ObjectRef> pending;
  std::set<uint64_t> seen;
  bool armed = false;
  bool ended = false;

  ObjectRef Next() {
    if (pending.empty()) {
      armed = true;
      return nullptr;
    }
    ObjectRef next = std::move(pending.front());
    pending.pop_front();
    return next;
  }

  void Add(const ObjectRef& object) {
    if (kind == MatchKind::FirstMatch && !seen.insert(object->EntryId()).second) return;
    pending.push_back(object);
    if (!armed || !handler) return;
    auto portState = port.lock();
    if (!portState) return;
    armed = false;
    portState->Schedule([weak = weak_from_this()] {
      auto self = weak.lock();
      if (!self || self->ended) return;
      class View final : public Iterator {
       public:
        explicit View(MatchWatch& watch) : watch_(watch) {}
        ObjectRef Next() override { return watch_.Next(); }
        void Reset() override {}
        bool IsValid() const override { return true; }

       private:
        MatchWatch& watch_;
      } view(*self);
      MatchHandler handler = self->handler;
      handler(view);
    });
  }
};

struct RegistryModel::InterestWatch {
  std::weak_ptr<PortState> port;
  InterestHandler handler;
  bool ended = false;
};

namespace {

class WatchIterator final : public Iterator {
 public:
  explicit WatchIterator(std::shared_ptr<RegistryModel::MatchWatch> watch);
  ~WatchIterator() override;
  ObjectRef Next() override;
  void Reset() override {}
  bool IsValid() const override { return true; }

 private:
  std::shared_ptr<RegistryModel::MatchWatch> watch_;
};

class InterestHandle final : public Notification {
 public:
  explicit InterestHandle(std::shared_ptr<RegistryModel::InterestWatch> watch)
      : watch_(std::move(watch)) {}
  ~InterestHandle() override { watch_->ended = true; }

 private:
  std::shared_ptr<RegistryModel::InterestWatch> watch_;
};

void ScheduleTerminated(const std::shared_ptr<RegistryModel::InterestWatch>& watch,
                        const ObjectRef& object) {
  auto port = watch->port.lock();
  if (!port) return;
  port->Schedule([weak = std::weak_ptr(watch), object] {
    auto self = weak.lock();
    if (!self || self->ended || !self->handler) return;
    InterestHandler handler = self->handler;
    handler(object, kMessageServiceIsTerminated);
  });
}

}  // namespace

WatchIterator::WatchIterator(std::shared_ptr<RegistryModel::MatchWatch> watch)
    : watch_(std::move(watch)) {}
WatchIterator::~WatchIterator() {
  watch_->ended = true;
  watch_->pending.clear();
}
ObjectRef WatchIterator::Next() { return watch_->Next(); }

RegistryModel::RegistryModel() = default;

RegistryModel::~RegistryModel() {
  for (auto& [id, node] : nodes_) node->terminated = true;
}

bool RegistryModel::DefineClass(std::string_view name, std::string_view superclass) {
  if (name.empty() || superclass.empty() || name == kServiceClass) return false;
  if (auto it = superclass_.find(name); it != superclass_.end()) return it->second == superclass;
  for (const auto& ancestor : ClassChain(superclass)) {
    if (ancestor == name) return false;
  }
  if (superclass != kServiceClass && !superclass_.contains(superclass)) {
    superclass_.emplace(std::string(superclass), std::string(kServiceClass));
  }
  superclass_.emplace(std::string(name), std::string(superclass));
  return true;
}

std::vector<std::string> RegistryModel::ClassChain(std::string_view name) const {
  std::vector<std::string> chain{std::string(name)};
  std::string_view current = name;
  while (current != kServiceClass && chain.size() <= superclass_.size() + 1) {
    auto it = superclass_.find(current);
    current = it == superclass_.end() ? kServiceClass : std::string_view(it->second);
    chain.emplace_back(current);
  }
  return chain;
}

std::shared_ptr<RegistryModel::Node> RegistryModel::LiveNode(const ObjectRef& object) const {
  if (!object) return nullptr;
  auto it = nodes_.find(object->EntryId());
  if (it == nodes_.end() || it->second.get() != object.get()) return nullptr;
  return it->second;
}

ObjectRef RegistryModel::Publish(const ObjectRef& parent, std::string_view className,
                                 plist::Dictionary properties) {
  if (className.empty()) return nullptr;
  std::shared_ptr<Node> parentNode;
  if (parent && !(parentNode = LiveNode(parent))) return nullptr;
  if (className != kServiceClass && !superclass_.contains(className)) {
    DefineClass(className, kServiceClass);
  }
  auto node = std::make_shared<Node>();
  node->id = nextId_++;
  node->className = std::string(className);
  node->chain = ClassChain(className);
  node->properties = plist::Value(std::move(properties));
  node->parent = parentNode;
  if (parentNode) parentNode->children.push_back(node);
  nodes_.emplace(node->id, node);
  IndexName(*node, true);
  Offer(node, LiveWatches(), nullptr);
  return node;
}

bool RegistryModel::SetProperties(const ObjectRef& object, plist::Dictionary properties) {
  auto node = LiveNode(object);
  if (!node) return false;
  auto watches = LiveWatches();
  std::vector<bool> before;
  before.reserve(watches.size());
  for (const auto& watch : watches) before.push_back(Matches(watch->matching, *node));
  IndexName(*node, false);
  node->properties = plist::Value(std::move(properties));
  IndexName(*node, true);
  Offer(node, watches, &before);
  return true;
}

void RegistryModel::Offer(const std::shared_ptr<Node>& node,
                          const std::vector<std::shared_ptr<MatchWatch>>& watches,
                          const std::vector<bool>* matchedBefore) {
  for (size_t i = 0; i < watches.size(); ++i) {
    if (matchedBefore && (*matchedBefore)[i]) continue;
    if (Matches(watches[i]->matching, *node)) watches[i]->Add(node);
  }
}

std::vector<std::shared_ptr<RegistryModel::MatchWatch>> RegistryModel::LiveWatches() {
  std::vector<std::shared_ptr<MatchWatch>> live;
  std::erase_if(matchWatches_, [&](const std::weak_ptr<MatchWatch>& weak) {
    auto watch = weak.lock();
    if (!watch || watch->ended) return true;
    live.push_back(std::move(watch));
    return false;
  });
  return live;
}

void RegistryModel::Terminate(const ObjectRef& object) {
  auto node = LiveNode(object);
  if (!node) return;
  for (const auto& child : node->Children()) Terminate(child);
  TerminateOne(node);
}

void RegistryModel::TerminateOne(const std::shared_ptr<Node>& node) {
  node->terminated = true;
  node->userClients = nullptr;
  IndexName(*node, false);
  nodes_.erase(node->id);
  if (node->parent) {
    std::erase_if(node->parent->children, [&](const std::weak_ptr<Node>& weak) {
      auto child = weak.lock();
      return !child || child == node;
    });
  }
  auto [first, last] = interestWatches_.equal_range(node->id);
  std::vector<std::shared_ptr<InterestWatch>> watches;
  for (auto it = first; it != last; ++it) {
    if (auto watch = it->second.lock(); watch && !watch->ended) watches.push_back(watch);
  }
  interestWatches_.erase(first, last);
  for (const auto& watch : watches) ScheduleTerminated(watch, node);
}

bool RegistryModel::SetUserClientFactory(const ObjectRef& object, UserClientFactory factory) {
  auto node = LiveNode(object);
  if (!node) return false;
  node->userClients = std::move(factory);
  return true;
}

std::vector<ObjectRef> RegistryModel::TopLevelObjects() const {
  std::vector<ObjectRef> top;
  for (const auto& [id, node] : nodes_) {
    if (!node->parent) top.push_back(node);
  }
  return top;
}

size_t RegistryModel::ObjectCount() const { return nodes_.size(); }

void RegistryModel::AddProvider(Provider* provider) { providers_.push_back(provider); }

void RegistryModel::RemoveProvider(Provider* provider) { std::erase(providers_, provider); }

namespace {

// Matches() without copying property values, properties first: in a registry of many
// media a lookup by "BSD Name" is decided by one short string comparison per object.
bool NodeMatches(const Matching& matching, const plist::Value& properties,
                 const std::vector<std::string>& chain) {
  for (const auto& [key, wanted] : matching.properties) {
    const plist::Value* value = properties.get(key);
    if (!value || !(*value == wanted)) return false;
  }
  return std::find(chain.begin(), chain.end(), matching.className) != chain.end();
}

}  // namespace

void RegistryModel::IndexName(const Node& node, bool add) {
  const std::string* name = node.properties.getString(kBsdNameKey);
  if (!name) return;
  if (add) {
    bsdNames_[*name].insert(node.id);
  } else if (auto found = bsdNames_.find(*name); found != bsdNames_.end()) {
    found->second.erase(node.id);
    if (found->second.empty()) bsdNames_.erase(found);
  }
}

void RegistryModel::ForEachCandidate(const Matching& matching,
                                     const std::function<bool(const std::shared_ptr<Node>&)>& visit) const {
  // Looking media up by kernel name is what every listing does for every mount; the
  // index keeps that from scanning the whole registry.
  if (const plist::Value* name = matching.properties.find(kBsdNameKey); name && name->string()) {
    const auto ids = bsdNames_.find(*name->string());
    if (ids == bsdNames_.end()) return;
    for (uint64_t id : ids->second) {
      if (!visit(nodes_.at(id))) return;
    }
    return;
  }
  for (const auto& [id, node] : nodes_) {
    if (!visit(node)) return;
  }
}

Result<std::unique_ptr<Iterator>> RegistryModel::GetMatchingServices(const Matching& matching) {
  std::vector<ObjectRef> found;
  ForEachCandidate(matching, [&](const std::shared_ptr<Node>& node) {
    if (NodeMatches(matching, node->properties, node->chain)) found.push_back(node);
    return true;
  });
  return {kSuccess, std::make_unique<SnapshotIterator>(std::move(found))};
}

ObjectRef RegistryModel::GetMatchingService(const Matching& matching) {
  ObjectRef found;
  ForEachCandidate(matching, [&](const std::shared_ptr<Node>& node) {
    if (NodeMatches(matching, node->properties, node->chain)) found = node;
    return !found;
  });
  return found;
}

Result<std::unique_ptr<NotificationPort>> RegistryModel::CreateNotificationPort() {
  return {kSuccess, std::make_unique<ModelPort>()};
}

Result<std::unique_ptr<Iterator>> RegistryModel::AddMatchingNotification(
    NotificationPort& port, MatchKind kind, const Matching& matching, MatchHandler handler) {
  auto* modelPort = dynamic_cast<ModelPort*>(&port);
  if (!modelPort || matching.className.empty()) return {kBadArgument, nullptr};
  auto watch = std::make_shared<MatchWatch>();
  watch->kind = kind;
  watch->matching = matching;
  watch->handler = std::move(handler);
  watch->port = modelPort->state();
  for (const auto& [id, node] : nodes_) {
    if (Matches(matching, *node)) watch->Add(node);
  }
  matchWatches_.push_back(watch);
  return {kSuccess, std::make_unique<WatchIterator>(std::move(watch))};
}

Result<std::unique_ptr<Notification>> RegistryModel::AddInterestNotification(
    NotificationPort& port, const ObjectRef& object, InterestHandler handler) {
  auto* modelPort = dynamic_cast<ModelPort*>(&port);
  auto* node = dynamic_cast<const Node*>(object.get());
  if (!modelPort || !node) return {kBadArgument, nullptr};
  auto watch = std::make_shared<InterestWatch>();
  watch->port = modelPort->state();
  watch->handler = std::move(handler);
  if (node->terminated) {
    ScheduleTerminated(watch, object);
  } else {
    interestWatches_.emplace(node->id, watch);
  }
  return {kSuccess, std::make_unique<InterestHandle>(std::move(watch))};
}

Result<std::unique_ptr<UserClient>> RegistryModel::Open(const ObjectRef& service, uint32_t type) {
  auto node = LiveNode(service);
  if (!node) return {kNoDevice, nullptr};
  if (!node->userClients) return {kUnsupported, nullptr};
  UserClientFactory factory = node->userClients;
  return factory(type);
}

void RegistryModel::Refresh(RefreshReason reason) {
  auto providers = providers_;
  for (Provider* provider : providers) {
    if (std::find(providers_.begin(), providers_.end(), provider) != providers_.end()) {
      provider->Refresh(reason);
    }
  }
}

}  // namespace brisvale::registry
