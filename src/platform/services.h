// The platform services of this process, set once at start-up by the entry point
// (tests install fakes with ScopedServices). Handlers reach the registry, the
// operating system, the transport and the notification centre through here, so their signatures stay those of
// the request protocol.
#pragma once

namespace brisvale {
namespace registry {
class DeviceRegistry;
}
namespace os {
class Os;
}
namespace ipc {
class IpcService;
}
namespace notify {
class SystemNotify;
}
namespace jobs {
class JobLauncher;
}
namespace alert {
class UserAlertService;
}

struct Services {
  registry::DeviceRegistry* registry = nullptr;
  os::Os* os = nullptr;
  ipc::IpcService* ipc = nullptr;
  notify::SystemNotify* notify = nullptr;
  alert::UserAlertService* alerts = nullptr;
  jobs::JobLauncher* jobLauncher = nullptr;
};

inline Services& CurrentServices() {
  static Services services;
  return services;
}

// Installs `services` for its lifetime and restores the previous ones afterwards.
class ScopedServices {
 public:
  explicit ScopedServices(const Services& services) : previous_(CurrentServices()) {
    CurrentServices() = services;
  }
  ~ScopedServices() { CurrentServices() = previous_; }
  ScopedServices(const ScopedServices&) = delete;
  ScopedServices& operator=(const ScopedServices&) = delete;

 private:
  Services previous_;
};

}  // namespace brisvale
