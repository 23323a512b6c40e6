// The simulated device provider: devices files published, reloaded and refused.
#include "registry/simulated_devices.h"

#include <gtest/gtest.h>

#include <fstream>

#include "base/log.h"
#include "test_files.h"

namespace brisvale::registry {
namespace {

using plist::Dictionary;
using plist::Value;

Value Object(const char* name, Value cls, Dictionary properties, plist::Array children = {}) {
  return Value(Dictionary{{"Name", Value(name)},
                          {"Class", std::move(cls)},
                          {"Properties", Value(std::move(properties))},
                          {"Children", Value(std::move(children))}});
}

// A devices file with a USB stick with one partition and a camera, either optional.
std::string DevicesFile(bool withStick, bool withCamera, bool stickWritable = false) {
  plist::Array objects;
  Dictionary removable{{"removable", Value::Bool(true)}};
  if (withStick) {
    const Dictionary partition{
        {"BSD Name", Value("disk9s1")}, {"Leaf", Value::Bool(true)}, {"Writable", Value::Bool(stickWritable)}};
    Value data = Object("data", "KxMedia", partition);
    Value disk = Object("disk", "KxMedia", {{"BSD Name", Value("disk9")}, {"Leaf", Value::Bool(false)}}, {data});
    objects.push_back(Object("stick", "KxUSBHostDevice", removable, {disk}));
  }
  if (withCamera) {
    Value chain(plist::Array{Value("KxUSBHostInterface"), Value("KxUSBInterface")});
    const Dictionary ptp{{"bInterfaceClass", Value::Int(6)}, {"bInterfaceSubClass", Value::Int(1)},
                         {"bInterfaceProtocol", Value::Int(1)}};
    Value ptpInterface(Dictionary{{"Class", chain}, {"Properties", Value(ptp)}});
    objects.push_back(Object("camera", "KxUSBHostDevice", removable, {ptpInterface}));
  }
  return plist::WriteXml(Value(Dictionary{{"Objects", Value(std::move(objects))}}));
}

class SimulatedDevicesTest : public ::testing::Test {
 protected:
  void Write(const std::string& text) { std::ofstream(path, std::ios::trunc) << text; }

  brisvale::testing::ScratchDir dir;
  const std::string path = dir.str() + "/devices.plist";
  RegistryModel model;
};

TEST_F(SimulatedDevicesTest, ReloadPublishesAddsAndTerminatesByPathInTheTree) {
  Write(DevicesFile(true, false));
  SimulatedDevices devices(model, path);
  ASSERT_TRUE(devices.Reload());
  ObjectRef data = devices.Find({"stick", "disk", "data"});
  ASSERT_NE(data, nullptr);
  EXPECT_EQ(SearchProperty(data, "removable"), plist::Value::Bool(true));
  EXPECT_EQ(data->Parent().value, devices.Find({"stick", "disk"}));

  // Plug the camera in, make the stick writable: the stick keeps its objects.
  Write(DevicesFile(true, true, true));
  model.Refresh(RefreshReason::Request);  // requests do not re-read the file
  EXPECT_EQ(devices.Find({"camera"}), nullptr);
  model.Refresh(RefreshReason::HardwareEvent);
  EXPECT_EQ(devices.Find({"stick", "disk", "data"}), data);
  EXPECT_EQ(data->Property("Writable"), plist::Value::Bool(true));
  const ObjectRef ptp = devices.Find({"camera", "#0"});
  ASSERT_TRUE(ptp && ptp->ConformsTo("KxUSBInterface"));
  EXPECT_EQ(model.GetMatchingService(Matching::Class("KxUSBInterface").Set("bInterfaceClass", Value::Int(6))), ptp);

  // Pull the stick: its whole subtree goes, the camera stays the object it was.
  Write(DevicesFile(false, true));
  ASSERT_TRUE(devices.Reload());
  EXPECT_TRUE(data->IsTerminated());
  EXPECT_EQ(devices.Find({"stick"}), nullptr);
  EXPECT_EQ(devices.Find({"camera", "#0"}), ptp);
}

TEST_F(SimulatedDevicesTest, UnusableFileKeepsTheRegistryAndSaysWhyAndGoingAwayTakesItsObjects) {
  Write(DevicesFile(true, true));
  auto devices = std::make_unique<SimulatedDevices>(model, path);
  ASSERT_TRUE(devices->Reload());
  ASSERT_EQ(model.ObjectCount(), 5u);

  const struct {
    const char* label;
    std::string text;
    const char* reason;
  } cases[] = {
      {"not a property list", "garbage", "syntax error"},
      {"top level", "<plist><array/></plist>", "the top level is not a dictionary"},
      {"no objects", "<plist><dict/></plist>", "\"Objects\" is missing or not an array"},
      {"no class", "<plist><dict><key>Objects</key><array><dict/></array></dict></plist>",
       "object /#0: has no \"Class\""},
      {"duplicate names",
       "<plist><dict><key>Objects</key><array>"
       "<dict><key>Name</key><string>a</string><key>Class</key><string>KxMedia</string></dict>"
       "<dict><key>Name</key><string>a</string><key>Class</key><string>KxMedia</string></dict>"
       "</array></dict></plist>",
       "object /a: has a duplicate name"},
      {"bad children",
       "<plist><dict><key>Objects</key><array><dict><key>Class</key><string>KxMedia</string>"
       "<key>Children</key><string>x</string></dict></array></dict></plist>",
       "object /#0: \"Children\" is not an array"},
      {"contradicting class chain",
       "<plist><dict><key>Objects</key><array><dict><key>Class</key><array>"
       "<string>KxUSBHostInterface</string><string>KxMedia</string></array></dict>"
       "</array></dict></plist>",
       "object /#0: class KxUSBHostInterface does not derive from KxMedia"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.label);
    Write(c.text);
    log::CaptureSink capture;
    std::string error;
    EXPECT_FALSE(devices->Reload(&error));
    EXPECT_EQ(error, c.reason);
    EXPECT_TRUE(capture.Contains(Level::Default, "Failed to read devices file " + path + ": " + error));
    EXPECT_EQ(model.ObjectCount(), 5u);
  }
  std::filesystem::remove(path);
  EXPECT_FALSE(devices->Reload());
  EXPECT_EQ(model.ObjectCount(), 5u);

  devices.reset();
  EXPECT_EQ(model.ObjectCount(), 0u);
  model.Refresh(RefreshReason::HardwareEvent);  // no dangling provider
}

}  // namespace
}  // namespace brisvale::registry
