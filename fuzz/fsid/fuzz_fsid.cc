// Arbitrary bytes as the contents of a device node: shorter than a volume header means
// a short read, longer means the node goes on past it.
#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "base/log.h"
#include "media/fs_identify.h"

namespace {

class DiscardSink : public brisvale::log::Sink {
 public:
  void Write(brisvale::log::Level, std::string_view) override {}
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static DiscardSink sink;
  static bool installed = (brisvale::log::SetSink(&sink), true);
  (void)installed;

  const auto reader = [&](const char*, brisvale::VolumeHeaderSpan header) {
    const size_t copied = std::min(size, header.size());
    std::copy(data, data + copied, header.begin());
    if (copied < header.size()) return brisvale::VolumeHeaderRead{brisvale::VolumeHeaderRead::Outcome::ReadFailed, EIO};
    return brisvale::VolumeHeaderRead{};
  };
  const brisvale::FsType type = brisvale::IdentifyFilesystem("/dev/fuzz", reader);
  if (type > brisvale::FsTypeNTFS || (size < brisvale::kVolumeHeaderLength && type != brisvale::FsTypeUnknown)) {
    std::abort();
  }
  return 0;
}
