// The device registry as the daemon sees it: a tree of objects that drivers publish
// (media, USB devices and interfaces, the disk-image driver's drive and controller),
// each with a class chain ending in "KxService", a property dictionary and one parent.
// The daemon finds objects by matching descriptions, walks parents, reads properties,
// subscribes to first-match and removal notifications delivered on the main loop, and
// calls methods of driver user clients.
//
// Ownership is by reference: an ObjectRef keeps its object readable after the object
// has left the registry (it then reports IsTerminated() and has no parent); iterators,
// ports, interest notifications and user clients end what they stand for when they are
// destroyed. Everything here is used from the main thread only.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/plist.h"

namespace brisvale {
class RunLoop;
}

namespace brisvale::registry {

// Registry status codes. Callers log them as `status & 0x3FFF`.
using Status = uint32_t;
inline constexpr Status kSuccess = 0;
inline constexpr Status kError = 0xe00002bc;
inline constexpr Status kNoMemory = 0xe00002bd;
inline constexpr Status kNoResources = 0xe00002be;
inline constexpr Status kNoDevice = 0xe00002c0;  // no such object (also: no parent)
inline constexpr Status kBadArgument = 0xe00002c2;
inline constexpr Status kUnsupported = 0xe00002c7;
inline constexpr Status kNotFound = 0xe00002f0;

// The general-interest message that says an object has left the registry.
inline constexpr uint32_t kMessageServiceIsTerminated = 0xe0000010;

// The root of every class chain, and the one plane objects hang in.
inline constexpr std::string_view kServiceClass = "KxService";
inline constexpr std::string_view kServicePlane = "KxService";

template <typename T>
struct Result {
  Status status = kSuccess;
  T value{};
  bool ok() const { return status == kSuccess; }
};

class Object;
using ObjectRef = std::shared_ptr<const Object>;

class Object {
 public:
  virtual ~Object() = default;

  // Unique for the life of the registry; never reused.
  virtual uint64_t EntryId() const = 0;
  // The most derived class.
  virtual const std::string& ClassName() const = 0;
  // True when the object is of `className` or of a subclass of it.
  virtual bool ConformsTo(std::string_view className) const = 0;
  // One property, or none when the object lacks it.
  virtual std::optional<plist::Value> Property(std::string_view key) const = 0;
  // All properties as one dictionary value (a snapshot).
  virtual Result<plist::Value> CopyProperties() const = 0;
  // kNoDevice for a top-level object and for one that has been terminated.
  virtual Result<ObjectRef> Parent() const = 0;
  // The live children, in publication order.
  virtual std::vector<ObjectRef> Children() const = 0;
  virtual bool IsTerminated() const = 0;
};

// Objects of a class (or a subclass) whose properties include each of `properties`
// with an equal value.
struct Matching {
  std::string className;
  plist::Dictionary properties;

  static Matching Class(std::string className) { return Matching{std::move(className), {}}; }
  // The medium whose kernel name is `bsdName` ("disk2s1", "sda1", "loop3").
  static Matching BsdName(std::string bsdName) {
    Matching matching = Class("KxMedia");
    matching.properties.set("BSD Name", plist::Value(std::move(bsdName)));
    return matching;
  }
  Matching& Set(std::string key, plist::Value value) {
    properties.set(std::move(key), std::move(value));
    return *this;
  }
};

inline bool Matches(const Matching& matching, const Object& object) {
  if (!object.ConformsTo(matching.className)) return false;
  for (const auto& [key, wanted] : matching.properties) {
    auto value = object.Property(key);
    if (!value || !(*value == wanted)) return false;
  }
  return true;
}

// A sequence of objects. Next() answers nullptr when exhausted. Destroying the iterator
// of a matching notification ends that notification.
class Iterator {
 public:
  virtual ~Iterator() = default;
  virtual ObjectRef Next() = 0;
  virtual void Reset() = 0;
  virtual bool IsValid() const = 0;
};

// Carries notifications to the main loop. Until Attach() nothing is delivered (the
// messages wait); destroying the port ends every notification added on it.
class NotificationPort {
 public:
  virtual ~NotificationPort() = default;
  virtual void Attach(RunLoop& loop) = 0;
};

// An interest notification on one object; destroying it ends the notification.
class Notification {
 public:
  virtual ~Notification() = default;
};

enum class MatchKind {
  FirstMatch,  // "KxServiceFirstMatch": each object at most once per notification
  Matched,     // "KxServiceMatched": each time an object comes to match
};

// Called on the main loop with the notification's iterator. The handler must take
// objects until Next() answers nullptr: only a drained iterator delivers again.
using MatchHandler = std::function<void(Iterator& iterator)>;
// Called on the main loop with a general-interest message about `object`.
using InterestHandler = std::function<void(const ObjectRef& object, uint32_t message)>;

// Arguments of a user-client method. The method fills the outputs, at most
// structOutCapacity bytes of structure output.
struct MethodArgs {
  std::span<const uint64_t> scalarIn;
  std::span<const uint8_t> structIn;
  std::vector<uint64_t> scalarOut;
  std::vector<uint8_t> structOut;
  size_t structOutCapacity = 0;
};

// An open connection to a driver; destroying it closes the connection.
class UserClient {
 public:
  virtual ~UserClient() = default;
  virtual Status CallMethod(uint32_t selector, MethodArgs& args) = 0;
};

// When the daemon asks the providers to bring the registry up to date.
enum class RefreshReason {
  Request,        // before each client request: pending kernel events are taken in
  HardwareEvent,  // before each hardware event: also re-reads simulated devices
};

class DeviceRegistry {
 public:
  virtual ~DeviceRegistry() = default;

  // Every live object that matches now, in publication order.
  virtual Result<std::unique_ptr<Iterator>> GetMatchingServices(const Matching& matching) = 0;
  // The first of them, or nullptr.
  virtual ObjectRef GetMatchingService(const Matching& matching) = 0;

  virtual Result<std::unique_ptr<NotificationPort>> CreateNotificationPort() = 0;
  // The returned iterator holds every object that matches now; once drained, objects
  // that come to match later are delivered to `handler` through `port`. Without a
  // handler the iterator only collects.
  virtual Result<std::unique_ptr<Iterator>> AddMatchingNotification(NotificationPort& port,
                                                                    MatchKind kind,
                                                                    const Matching& matching,
                                                                    MatchHandler handler) = 0;
  // Delivers kMessageServiceIsTerminated through `port` when `object` leaves the
  // registry (at once when it already has).
  virtual Result<std::unique_ptr<Notification>> AddInterestNotification(
      NotificationPort& port, const ObjectRef& object, InterestHandler handler) = 0;

  // Opens the driver connection of `type` on `service`.
  virtual Result<std::unique_ptr<UserClient>> Open(const ObjectRef& service, uint32_t type) = 0;

  virtual void Refresh(RefreshReason reason) = 0;
};

// The value of `key` on `object` or, failing that, on the nearest ancestor that has it.
inline std::optional<plist::Value> SearchProperty(const ObjectRef& object, std::string_view key) {
  for (ObjectRef current = object; current;) {
    if (auto value = current->Property(key)) return value;
    auto parent = current->Parent();
    if (!parent.ok()) break;
    current = std::move(parent.value);
  }
  return std::nullopt;
}

// The parent, grandparent and so on up to the top of the tree.
inline std::vector<ObjectRef> Ancestors(const ObjectRef& object) {
  std::vector<ObjectRef> ancestors;
  for (auto parent = object ? object->Parent() : Result<ObjectRef>{kNoDevice, nullptr};
       parent.ok() && parent.value; parent = parent.value->Parent()) {
    ancestors.push_back(parent.value);
  }
  return ancestors;
}

}  // namespace brisvale::registry
