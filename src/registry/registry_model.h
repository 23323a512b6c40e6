// The in-process device registry: the one registry the daemon queries, filled by
// providers (sysfs and kernel events on Linux, a simulated device tree, later the
// disk-image controller). Providers publish, update and terminate objects here; the
// model runs the matching and interest notifications that follow from that. Tests
// populate it directly.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/device_registry.h"

namespace brisvale::registry {

// Brings part of the registry up to date when the daemon asks (see RefreshReason).
class Provider {
 public:
  virtual ~Provider() = default;
  virtual void Refresh(RefreshReason reason) = 0;
};

// Opens a driver connection of the given type.
using UserClientFactory = std::function<Result<std::unique_ptr<UserClient>>(uint32_t type)>;

class RegistryModel final : public DeviceRegistry {
 public:
  RegistryModel();
  ~RegistryModel() override;
  RegistryModel(const RegistryModel&) = delete;
  RegistryModel& operator=(const RegistryModel&) = delete;

  // Declares `name` a subclass of `superclass` (which, when undeclared, becomes a
  // direct subclass of "KxService"). False when `name` is already declared with a
  // different superclass or the chain would loop. Publishing an undeclared class
  // declares it as a direct subclass of "KxService".
  bool DefineClass(std::string_view name, std::string_view superclass);
  // Most derived first, "KxService" last.
  std::vector<std::string> ClassChain(std::string_view name) const;

  // Adds an object below `parent` (nullptr: top level) and runs the matching
  // notifications. nullptr when the parent is not a live object of this registry.
  ObjectRef Publish(const ObjectRef& parent, std::string_view className,
                    plist::Dictionary properties);
  // Replaces an object's properties; objects that come to match are delivered.
  bool SetProperties(const ObjectRef& object, plist::Dictionary properties);
  // Removes the object and everything below it, deepest first, each with its
  // terminated interest message.
  void Terminate(const ObjectRef& object);
  // The driver behind Open() for this object.
  bool SetUserClientFactory(const ObjectRef& object, UserClientFactory factory);

  std::vector<ObjectRef> TopLevelObjects() const;
  size_t ObjectCount() const;

  // Providers are asked in the order they were added. A provider removes itself before
  // it goes away.
  void AddProvider(Provider* provider);
  void RemoveProvider(Provider* provider);

  // DeviceRegistry
  Result<std::unique_ptr<Iterator>> GetMatchingServices(const Matching& matching) override;
  ObjectRef GetMatchingService(const Matching& matching) override;
  Result<std::unique_ptr<NotificationPort>> CreateNotificationPort() override;
  Result<std::unique_ptr<Iterator>> AddMatchingNotification(NotificationPort& port,
                                                            MatchKind kind,
                                                            const Matching& matching,
                                                            MatchHandler handler) override;
  Result<std::unique_ptr<Notification>> AddInterestNotification(NotificationPort& port,
                                                                const ObjectRef& object,
                                                                InterestHandler handler) override;
  Result<std::unique_ptr<UserClient>> Open(const ObjectRef& service, uint32_t type) override;
  void Refresh(RefreshReason reason) override;

  // Notification state, shared with the handles given out; defined in the .cc file.
  struct MatchWatch;
  struct InterestWatch;

 private:
  struct Node;
  std::shared_ptr<Node> LiveNode(const ObjectRef& object) const;
  // Hands the object to every matching notification it now matches; with
  // `matchedBefore`, only to those it did not match before a property change.
  void Offer(const std::shared_ptr<Node>& node,
             const std::vector<std::shared_ptr<MatchWatch>>& watches,
             const std::vector<bool>* matchedBefore);
  std::vector<std::shared_ptr<MatchWatch>> LiveWatches();
  void TerminateOne(const std::shared_ptr<Node>& node);
  // Keeps bsdNames_ in step with a node's "BSD Name".
  void IndexName(const Node& node, bool add);
  // The nodes a matching can hold, in publication order; `visit` answers false to stop.
  void ForEachCandidate(const Matching& matching,
                        const std::function<bool(const std::shared_ptr<Node>&)>& visit) const;

  std::map<std::string, std::string, std::less<>> superclass_;
  std::map<uint64_t, std::shared_ptr<Node>> nodes_;  // live objects, in publication order
  uint64_t nextId_ = 1;
  std::vector<std::weak_ptr<MatchWatch>> matchWatches_;
  std::multimap<uint64_t, std::weak_ptr<InterestWatch>> interestWatches_;
  std::vector<Provider*> providers_;
  static constexpr std::string_view kBsdNameKey = "BSD Name";
  std::map<std::string, std::set<uint64_t>, std::less<>> bsdNames_;  // live objects by name
};

}  // namespace brisvale::registry
