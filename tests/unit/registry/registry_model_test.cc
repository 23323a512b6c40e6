// The in-process device registry: matching, iterators, notifications, interest and termination.
#include "registry/registry_model.h"

#include <gtest/gtest.h>

#include "base/runloop.h"

namespace brisvale::registry {
namespace {

using namespace std::chrono_literals;
using Names = std::vector<std::string>;

plist::Dictionary Media(std::string bsdName, bool leaf = true) {
  return plist::Dictionary{{"BSD Name", plist::Value(std::move(bsdName))}, {"Leaf", plist::Value::Bool(leaf)}};
}

// What the iterator still holds: BSD names, or class names where there is none.
Names Drain(Iterator& iterator) {
  Names names;
  while (ObjectRef object = iterator.Next()) {
    auto name = object->Property("BSD Name");
    names.push_back(name && name->string() ? *name->string() : object->ClassName());
  }
  return names;
}

class RegistryModelTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(model.DefineClass("KxUSBHostInterface", "KxUSBInterface"));
    ASSERT_TRUE(model.DefineClass("KxPartitionMedia", "KxMedia"));
    usb = model.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
    disk = model.Publish(usb, "KxMedia", Media("sda", false));
    partition = model.Publish(disk, "KxPartitionMedia", Media("sda1"));
    camera = model.Publish(usb, "KxUSBHostInterface",
                           {{"bInterfaceClass", plist::Value::Int(6)},
                            {"bInterfaceSubClass", plist::Value::Int(1)},
                            {"bInterfaceProtocol", plist::Value::Int(1)}});
  }

  // Runs the loop until the queued deliveries have run.
  void Deliver() { loop.RunFor(20ms); }

  RunLoop loop;
  RegistryModel model;
  std::unique_ptr<NotificationPort> port = model.CreateNotificationPort().value;
  ObjectRef usb, disk, partition, camera;
};

TEST_F(RegistryModelTest, MatchesByClassIncludingSubclassesAndByPropertyValues) {
  const struct {
    const char* label;
    Matching matching;
    Names expected;
  } cases[] = {
      {"class with subclass", Matching::Class("KxMedia"), {"sda", "sda1"}},
      {"root class", Matching::Class("KxService"), {"KxUSBHostDevice", "sda", "sda1", "KxUSBHostInterface"}},
      {"bsd name", Matching::BsdName("sda1"), {"sda1"}},
      {"property value", Matching::Class("KxMedia").Set("Leaf", plist::Value::Bool(false)), {"sda"}},
      {"number differs", Matching::Class("KxUSBHostInterface").Set("bInterfaceProtocol", plist::Value::Int(2)), {}},
      {"missing property", Matching::Class("KxMedia").Set("Content", plist::Value("")), {}},
      {"unknown class", Matching::Class("KxNothing"), {}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.label);
    auto found = model.GetMatchingServices(c.matching);
    ASSERT_TRUE(found.ok());
    EXPECT_EQ(Drain(*found.value), c.expected);
    EXPECT_EQ(model.GetMatchingService(c.matching) != nullptr, !c.expected.empty());
  }
}

TEST_F(RegistryModelTest, ClassesParentsPropertySearchAndTermination) {
  EXPECT_FALSE(model.DefineClass("KxPartitionMedia", "KxStorage"));
  EXPECT_FALSE(model.DefineClass("KxMedia", "KxPartitionMedia"));  // would loop
  EXPECT_FALSE(model.DefineClass("KxService", "KxMedia"));
  EXPECT_EQ(model.ClassChain("KxPartitionMedia"), (Names{"KxPartitionMedia", "KxMedia", "KxService"}));

  EXPECT_EQ(usb->Parent().status, kNoDevice);
  EXPECT_EQ(Ancestors(partition), (std::vector<ObjectRef>{disk, usb}));
  EXPECT_EQ(SearchProperty(partition, "removable"), plist::Value::Bool(true));

  model.Terminate(disk);
  EXPECT_TRUE(disk->IsTerminated() && partition->IsTerminated());
  EXPECT_FALSE(usb->IsTerminated());
  // A retained object stays readable but is out of the tree.
  EXPECT_EQ(partition->Property("BSD Name"), plist::Value("sda1"));
  EXPECT_EQ(partition->Parent().status, kNoDevice);
  EXPECT_EQ(usb->Children(), std::vector<ObjectRef>{camera});
  EXPECT_EQ(model.GetMatchingService(Matching::Class("KxMedia")), nullptr);
  EXPECT_EQ(model.Publish(disk, "KxMedia", Media("sda2")), nullptr);
  EXPECT_FALSE(model.SetProperties(disk, {}));
}

TEST_F(RegistryModelTest, FirstMatchDeliversThroughThePortOnlyAfterTheIteratorIsDrained) {
  port->Attach(loop);
  std::vector<Names> delivered;
  auto added = model.AddMatchingNotification(*port, MatchKind::FirstMatch,
                                             Matching::Class("KxMedia").Set("Leaf", plist::Value::Bool(true)),
                                             [&](Iterator& it) { delivered.push_back(Drain(it)); });
  ASSERT_TRUE(added.ok());
  std::unique_ptr<Iterator> iterator = std::move(added.value);
  // What matches now is in the returned iterator, not delivered.
  model.Publish(usb, "KxMedia", Media("sdb"));
  Deliver();
  EXPECT_TRUE(delivered.empty());
  EXPECT_EQ(Drain(*iterator), (Names{"sda1", "sdb"}));

  // Drained: the next media come through the port, together, and only from the loop.
  model.Publish(usb, "KxMedia", Media("sdc"));
  model.Publish(usb, "KxMedia", Media("sdd"));
  model.Publish(usb, "KxUSBHostInterface", {});  // does not match
  EXPECT_TRUE(delivered.empty());
  Deliver();
  EXPECT_EQ(delivered, std::vector<Names>{(Names{"sdc", "sdd"})});

  // A first match does not come again, even when the object stops matching and
  // comes to match again.
  model.SetProperties(partition, Media("sda1", false));
  model.SetProperties(partition, Media("sda1", true));
  Deliver();
  EXPECT_EQ(delivered.size(), 1u);

  // Ending the notification (releasing its iterator) stops deliveries.
  iterator.reset();
  model.Publish(usb, "KxMedia", Media("sde"));
  Deliver();
  EXPECT_EQ(delivered.size(), 1u);
}

TEST_F(RegistryModelTest, TerminatedInterestReachesEveryWatchOfTheSubtreeOnce) {
  port->Attach(loop);
  Names terminated;
  const auto record = [&](const ObjectRef& gone, uint32_t message) {
    if (message == kMessageServiceIsTerminated) terminated.push_back(gone->ClassName());
  };
  const auto watch = [&](const ObjectRef& object) {
    return std::move(model.AddInterestNotification(*port, object, record).value);
  };
  auto onPartition = watch(partition), onDisk = watch(disk), onCamera = watch(camera), ended = watch(usb);
  ended.reset();  // released before the removal: never called
  model.Terminate(usb);
  EXPECT_TRUE(terminated.empty());
  Deliver();
  EXPECT_EQ(terminated, (Names{"KxPartitionMedia", "KxMedia", "KxUSBHostInterface"}));

  // Watching an object that is already gone says so at once.
  auto late = watch(disk);
  Deliver();
  EXPECT_EQ(terminated.back(), "KxMedia");
  EXPECT_EQ(terminated.size(), 4u);

  // A handler that destroys the port drops what is still queued on it.
  int calls = 0;
  auto dropAll = [&](const ObjectRef&, uint32_t) {
    ++calls;
    port.reset();
  };
  auto first = model.AddInterestNotification(*port, camera, dropAll);
  auto second = model.AddInterestNotification(*port, partition, dropAll);
  Deliver();
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace brisvale::registry
