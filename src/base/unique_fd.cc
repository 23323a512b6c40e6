#include "base/unique_fd.h"

#include <unistd.h>

namespace brisvale {

void CloseFd(int fd) { ::close(fd); }

}  // namespace brisvale
