#include "platform/linux/os_system.h"

namespace brisvale::os {

Os& SystemOs() {
  static LinuxOs os;
  return os;
}

}  // namespace brisvale::os
