// The in-process device registry: matching, iterators, notifications, interest and termination.
#include "registry/registry_model.h"

#include <gtest/gtest.h>

#include "base/runloop.h"

namespace brisvale::registry {
namespace {

using namespace std::chrono_literals;

plist::Dictionary Media(std::string bsdName, bool leaf = true) {
  return plist::Dictionary{{"BSD Name", plist::Value(std::move(bsdName))},
                           {"Leaf", plist::Value::Bool(leaf)}};
}

std::vector<std::string> Names(Iterator& iterator) {
  std::vector<std::string> names;
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
  ObjectRef usb, disk, partition, camera;
};

TEST_F(RegistryModelTest, MatchesByClassIncludingSubclassesAndByPropertyValues) {
  struct Case {
    const char* label;
    Matching matching;
    std::vector<std::string> expected;
  };
  const Case cases[] = {
      {"class with subclass", Matching::Class("KxMedia"), {"sda", "sda1"}},
      {"subclass only", Matching::Class("KxPartitionMedia"), {"sda1"}},
      {"root class", Matching::Class("KxService"),
       {"KxUSBHostDevice", "sda", "sda1", "KxUSBHostInterface"}},
      {"declared superclass", Matching::Class("KxUSBInterface"), {"KxUSBHostInterface"}},
      {"bsd name", Matching::BsdName("sda1"), {"sda1"}},
      {"property value", Matching::Class("KxMedia").Set("Leaf", plist::Value::Bool(false)),
       {"sda"}},
      {"numbers", Matching::Class("KxUSBHostInterface")
                      .Set("bInterfaceClass", plist::Value::Int(6))
                      .Set("bInterfaceProtocol", plist::Value::Int(1)),
       {"KxUSBHostInterface"}},
      {"number differs", Matching::Class("KxUSBHostInterface")
                             .Set("bInterfaceProtocol", plist::Value::Int(2)),
       {}},
      {"type differs", Matching::Class("KxUSBHostInterface")
                           .Set("bInterfaceClass", plist::Value("6")),
       {}},
      {"missing property", Matching::Class("KxMedia").Set("Content", plist::Value("")), {}},
      {"unknown class", Matching::Class("KxNothing"), {}},
  };
  for (const auto& c : cases) {
    auto found = model.GetMatchingServices(c.matching);
    ASSERT_TRUE(found.ok()) << c.label;
    EXPECT_EQ(Names(*found.value), c.expected) << c.label;
    ObjectRef first = model.GetMatchingService(c.matching);
    EXPECT_EQ(first != nullptr, !c.expected.empty()) << c.label;
  }
}

TEST_F(RegistryModelTest, ParentWalkPropertySearchAndTermination) {
  EXPECT_EQ(partition->Parent().value, disk);
  auto top = usb->Parent();
  EXPECT_EQ(top.status, kNoDevice);
  EXPECT_EQ(Ancestors(partition), (std::vector<ObjectRef>{disk, usb}));
  EXPECT_EQ(SearchProperty(partition, "removable"), plist::Value::Bool(true));
  EXPECT_EQ(SearchProperty(partition, "nothing"), std::nullopt);
  EXPECT_EQ(disk->Children(), std::vector<ObjectRef>{partition});
  EXPECT_EQ(partition->ClassName(), "KxPartitionMedia");
  EXPECT_TRUE(partition->ConformsTo("KxMedia"));
  EXPECT_TRUE(partition->ConformsTo("KxService"));
  EXPECT_FALSE(disk->ConformsTo("KxPartitionMedia"));

  model.Terminate(disk);
  EXPECT_TRUE(disk->IsTerminated());
  EXPECT_TRUE(partition->IsTerminated());
  EXPECT_FALSE(usb->IsTerminated());
  // A retained object stays readable but is out of the tree.
  EXPECT_EQ(partition->Property("BSD Name"), plist::Value("sda1"));
  EXPECT_EQ(partition->Parent().status, kNoDevice);
  EXPECT_EQ(usb->Children(), std::vector<ObjectRef>{camera});
  EXPECT_EQ(model.GetMatchingService(Matching::Class("KxMedia")), nullptr);
  EXPECT_EQ(model.Publish(disk, "KxMedia", Media("sda2")), nullptr);
  EXPECT_FALSE(model.SetProperties(disk, {}));
}

TEST_F(RegistryModelTest, ClassDeclarationsRefuseConflictsAndLoops) {
  EXPECT_TRUE(model.DefineClass("KxPartitionMedia", "KxMedia"));  // repeated, same
  EXPECT_FALSE(model.DefineClass("KxPartitionMedia", "KxStorage"));
  EXPECT_FALSE(model.DefineClass("KxMedia", "KxPartitionMedia"));  // would loop
  EXPECT_FALSE(model.DefineClass("KxService", "KxMedia"));
  EXPECT_EQ(model.ClassChain("KxPartitionMedia"),
            (std::vector<std::string>{"KxPartitionMedia", "KxMedia", "KxService"}));
}

TEST_F(RegistryModelTest, FirstMatchDeliversThroughThePortOnlyAfterTheIteratorIsDrained) {
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  std::vector<std::vector<std::string>> deliveries;
  auto added = model.AddMatchingNotification(
      *port, MatchKind::FirstMatch, Matching::Class("KxMedia").Set("Leaf", plist::Value::Bool(true)),
      [&](Iterator& it) { deliveries.push_back(Names(it)); });
  ASSERT_TRUE(added.ok());
  Iterator& iterator = *added.value;
  // What matches now is in the returned iterator, not delivered.
  model.Publish(usb, "KxMedia", Media("sdb"));
  Deliver();
  EXPECT_TRUE(deliveries.empty());
  EXPECT_EQ(Names(iterator), (std::vector<std::string>{"sda1", "sdb"}));

  // Drained: the next medium comes through the port, once.
  model.Publish(usb, "KxMedia", Media("sdc"));
  model.Publish(usb, "KxMedia", Media("sdd"));
  model.Publish(usb, "KxUSBHostInterface", {});  // does not match
  EXPECT_TRUE(deliveries.empty()) << "nothing is delivered outside the loop";
  Deliver();
  ASSERT_EQ(deliveries.size(), 1u);
  EXPECT_EQ(deliveries[0], (std::vector<std::string>{"sdc", "sdd"}));

  // A first match does not come again, even when the object stops matching and
  // comes to match again.
  model.SetProperties(partition, Media("sda1", false));
  model.SetProperties(partition, Media("sda1", true));
  Deliver();
  EXPECT_EQ(deliveries.size(), 1u);

  // Ending the notification (releasing its iterator) stops deliveries.
  added.value.reset();
  model.Publish(usb, "KxMedia", Media("sde"));
  Deliver();
  EXPECT_EQ(deliveries.size(), 1u);
}

TEST_F(RegistryModelTest, UndrainedIteratorCollectsWithoutDeliveringAgain) {
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  int calls = 0;
  auto added = model.AddMatchingNotification(*port, MatchKind::FirstMatch,
                                             Matching::Class("KxMedia"),
                                             [&](Iterator& it) {
                                               ++calls;
                                               it.Next();  // takes one, leaves the rest
                                             });
  Names(*added.value);
  model.Publish(usb, "KxMedia", Media("sdb"));
  model.Publish(usb, "KxMedia", Media("sdc"));
  Deliver();
  EXPECT_EQ(calls, 1);
  model.Publish(usb, "KxMedia", Media("sdd"));
  Deliver();
  EXPECT_EQ(calls, 1) << "an iterator that was not drained must not deliver again";
  EXPECT_EQ(Names(*added.value), (std::vector<std::string>{"sdc", "sdd"}));
  model.Publish(usb, "KxMedia", Media("sde"));
  Deliver();
  EXPECT_EQ(calls, 2);
}

TEST_F(RegistryModelTest, MatchedNotifiesObjectsThatComeToMatchAndPortsHoldUntilAttached) {
  auto port = model.CreateNotificationPort().value;
  std::vector<std::string> delivered;
  Matching bigDisk = Matching::Class("KxMedia").Set("Leaf", plist::Value::Bool(false));
  auto added = model.AddMatchingNotification(*port, MatchKind::Matched, bigDisk,
                                             [&](Iterator& it) {
                                               for (auto name : Names(it)) delivered.push_back(name);
                                             });
  EXPECT_EQ(Names(*added.value), std::vector<std::string>{"sda"});
  model.SetProperties(partition, Media("sda1", false));  // comes to match
  model.SetProperties(disk, Media("sda", false));        // matched before: nothing
  Deliver();
  EXPECT_TRUE(delivered.empty()) << "a port that is not attached delivers nothing";
  port->Attach(loop);
  Deliver();
  EXPECT_EQ(delivered, std::vector<std::string>{"sda1"});
  model.SetProperties(partition, Media("sda1", true));
  model.SetProperties(partition, Media("sda1", false));  // matches again
  Deliver();
  EXPECT_EQ(delivered, (std::vector<std::string>{"sda1", "sda1"}));

  // Without a handler the iterator only collects.
  auto silent = model.AddMatchingNotification(*port, MatchKind::Matched,
                                              Matching::Class("KxMedia"), nullptr);
  Names(*silent.value);
  model.Publish(usb, "KxMedia", Media("sdb"));
  Deliver();
  EXPECT_EQ(Names(*silent.value), std::vector<std::string>{"sdb"});
}

TEST_F(RegistryModelTest, TerminatedInterestReachesEveryWatchOfTheSubtree) {
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  std::vector<std::pair<std::string, uint32_t>> messages;
  auto watch = [&](const ObjectRef& object) {
    return std::move(model
                         .AddInterestNotification(*port, object,
                                                  [&](const ObjectRef& gone, uint32_t message) {
                                                    messages.emplace_back(gone->ClassName(), message);
                                                  })
                         .value);
  };
  auto onPartition = watch(partition);
  auto onDisk = watch(disk);
  auto onCamera = watch(camera);
  auto ended = watch(usb);
  ended.reset();  // released before the removal: never called

  model.Terminate(usb);
  EXPECT_TRUE(messages.empty());
  Deliver();
  using Message = std::pair<std::string, uint32_t>;
  EXPECT_EQ(messages, (std::vector<Message>{{"KxPartitionMedia", kMessageServiceIsTerminated},
                                            {"KxMedia", kMessageServiceIsTerminated},
                                            {"KxUSBHostInterface", kMessageServiceIsTerminated}}));

  // Watching an object that is already gone says so at once.
  messages.clear();
  auto late = watch(disk);
  Deliver();
  EXPECT_EQ(messages, (std::vector<Message>{{"KxMedia", kMessageServiceIsTerminated}}));
}

TEST_F(RegistryModelTest, DestroyingThePortInsideAHandlerDropsWhatIsStillQueued) {
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  int calls = 0;
  std::unique_ptr<Notification> first, second;
  auto handler = [&](const ObjectRef&, uint32_t) {
    ++calls;
    first.reset();
    second.reset();
    port.reset();
  };
  first = std::move(model.AddInterestNotification(*port, disk, handler).value);
  second = std::move(model.AddInterestNotification(*port, partition, handler).value);
  model.Terminate(disk);
  Deliver();
  EXPECT_EQ(calls, 1);
}

class RecordingClient final : public UserClient {
 public:
  explicit RecordingClient(uint32_t type) : type_(type) {}
  Status CallMethod(uint32_t selector, MethodArgs& args) override {
    if (selector != 2) return kUnsupported;
    args.scalarOut = {type_, args.structIn.size()};
    return kSuccess;
  }

 private:
  uint32_t type_;
};

TEST_F(RegistryModelTest, UserClientsOpenThroughTheDriverOfTheObject) {
  EXPECT_EQ(model.Open(disk, 0).status, kUnsupported);
  ObjectRef driver = model.Publish(nullptr, "Ferrovane", {});
  ASSERT_TRUE(model.SetUserClientFactory(driver, [](uint32_t type) {
    return Result<std::unique_ptr<UserClient>>{kSuccess, std::make_unique<RecordingClient>(type)};
  }));
  auto client = model.Open(driver, 7);
  ASSERT_TRUE(client.ok());
  const uint8_t bytes[3] = {1, 2, 3};
  MethodArgs args;
  args.structIn = bytes;
  EXPECT_EQ(client.value->CallMethod(2, args), kSuccess);
  EXPECT_EQ(args.scalarOut, (std::vector<uint64_t>{7, 3}));
  EXPECT_EQ(client.value->CallMethod(0, args), kUnsupported);
  model.Terminate(driver);
  EXPECT_EQ(model.Open(driver, 0).status, kNoDevice);
}

}  // namespace
}  // namespace brisvale::registry
