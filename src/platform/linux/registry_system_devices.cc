#include <libudev.h>
#include <sys/epoll.h>

#include <cerrno>
#include <map>
#include <set>

#include "base/c_handle.h"
#include "base/log.h"
#include "base/runloop.h"
#include "platform/linux/registry_sysfs.h"
#include "platform/linux/system_devices.h"

namespace brisvale::registry {
namespace {

constexpr int kEventBufferBytes = 4 << 20;

using UdevPtr = CHandle<udev, udev_unref>;
using MonitorPtr = CHandle<udev_monitor, udev_monitor_unref>;

MonitorPtr OpenKernelEvents(udev* context) {
  MonitorPtr monitor(udev_monitor_new_from_netlink(context, "kernel"));
  if (monitor) {
    udev_monitor_set_receive_buffer_size(monitor.get(), kEventBufferBytes);
    if (udev_monitor_enable_receiving(monitor.get()) == 0) return monitor;
  }
  Log(Level::Default, "Failed to listen to kernel device events: %{errno}d", errno);
  return nullptr;
}

class LinuxSystemDevices final : public SystemDevices {
 public:
  LinuxSystemDevices(RegistryModel& model, UdevPtr context, SystemDevicesOptions options)
      : model_(model), context_(std::move(context)), options_(std::move(options)) {
    model_.DefineClass("KxMedia", kServiceClass);
    model_.DefineClass("KxUSBHostDevice", kServiceClass);
    model_.DefineClass("KxUSBHostInterface", kServiceClass);
    model_.DefineClass("KxNimbrelHDDriveInKernel", kServiceClass);
    // Listening starts before the first scan, so nothing that happens in between is lost.
    monitor_ = OpenKernelEvents(context_.get());
    Rescan();
    model_.AddProvider(this);
  }

  ~LinuxSystemDevices() override {
    model_.RemoveProvider(this);
    source_.Reset();
    for (const auto& [key, object] : objects_) model_.Terminate(object);
  }

  void Listen(RunLoop& loop) {
    if (!monitor_) return;
    source_ = loop.AddFd(udev_monitor_get_fd(monitor_.get()), EPOLLIN,
                         [this](uint32_t) { Drain(); });
  }

  void Refresh(RefreshReason) override {
    if (monitor_) {
      Drain();
    } else {
      Rescan();
    }
  }

  void Rescan() override {
    sysfs::Snapshot snapshot = sysfs::Scan(context_.get(), options_.deviceRoot, cache_);
    Apply(snapshot.objects);
    KeepNodes(snapshot);
  }

 private:
  void Drain() {
    bool changed = false;
    for (;;) {
      errno = 0;
      CHandle<udev_device, udev_device_unref> event(
          udev_monitor_receive_device(monitor_.get()));
      if (!event) {
        // A full socket buffer drops events: only a rescan can tell what they were.
        if (errno == ENOBUFS) changed = true;
        break;
      }
      std::string_view subsystem = Text(udev_device_get_subsystem(event.get()));
      if (subsystem != "block" && subsystem != "usb") continue;
      changed = true;
      if (const char* syspath = udev_device_get_syspath(event.get())) cache_.Forget(syspath);
    }
    if (changed) Rescan();
  }

  static std::string_view Text(const char* text) {
    return text ? std::string_view(text) : std::string_view();
  }

  void Apply(const std::vector<sysfs::WantedObject>& wanted) {
    std::map<std::string_view, const sysfs::WantedObject*> byKey;
    for (const auto& object : wanted) byKey.emplace(object.key, &object);
    for (const auto& [key, object] : objects_) {
      auto it = byKey.find(key);
      if (it == byKey.end() || it->second->className != object->ClassName()) {
        model_.Terminate(object);
      }
    }
    std::erase_if(objects_, [](const auto& item) { return item.second->IsTerminated(); });

    for (const auto& object : wanted) {
      if (auto existing = objects_.find(object.key); existing != objects_.end()) {
        if (!(existing->second->CopyProperties().value == plist::Value(object.properties))) {
          model_.SetProperties(existing->second, object.properties);
        }
        continue;
      }
      ObjectRef parent;
      if (!object.parentKey.empty()) {
        auto it = objects_.find(object.parentKey);
        if (it == objects_.end()) continue;  // cannot happen: parents come first
        parent = it->second;
      }
      if (ObjectRef published = model_.Publish(parent, object.className, object.properties)) {
        objects_.emplace(object.key, std::move(published));
      }
    }
  }

  // Nodes this provider made go again when their device leaves sysfs, as devtmpfs
  // would remove them.
  void KeepNodes(const sysfs::Snapshot& snapshot) {
    for (const auto& node : snapshot.publishedNodes) {
      if (node.made) nodesMade_[node.name] = node.number;
    }
    std::set<std::string_view> present(snapshot.allBlockNames.begin(),
                                       snapshot.allBlockNames.end());
    std::erase_if(nodesMade_, [&](const auto& item) {
      if (present.contains(item.first)) return false;
      sysfs::RemoveBlockNode(options_.deviceRoot + "/" + item.first, item.second);
      return true;
    });
  }

  RegistryModel& model_;
  UdevPtr context_;
  SystemDevicesOptions options_;
  MonitorPtr monitor_;
  SourceHandle source_;
  sysfs::ProbeCache cache_;
  std::map<std::string, ObjectRef, std::less<>> objects_;
  std::map<std::string, dev_t> nodesMade_;
};

}  // namespace

std::unique_ptr<SystemDevices> StartSystemDevices(RegistryModel& model, RunLoop* loop,
                                                  SystemDevicesOptions options) {
  UdevPtr context(udev_new());
  if (!context) {
    Log(Level::Default, "Failed to open sysfs for device discovery.");
    return nullptr;
  }
  auto devices = std::make_unique<LinuxSystemDevices>(model, std::move(context), std::move(options));
  if (loop) devices->Listen(*loop);
  return devices;
}

}  // namespace brisvale::registry
