// Feeds arbitrary bytes to the transport's frame reader, split at a point the input
// chooses (so partial headers and payloads are exercised), then to the transport-key
// split and the kernel device-event translation, which see the same untrusted bytes.
#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_message.h"
#include "platform/linux/ipc_uevent.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::span<const uint8_t> input(data + 1, size - 1);
  const size_t split = input.empty() ? 0 : data[0] % (input.size() + 1);

  brisvale::ipc::FrameReader reader;
  std::vector<brisvale::plist::Dictionary> frames;
  if (!reader.Feed(input.first(split), frames)) reader.Feed(input.subspan(split), frames);
  for (brisvale::plist::Dictionary& frame : frames) {
    std::string error;
    if (auto message = brisvale::ipc::MessageFromFrame(std::move(frame), &error)) {
      brisvale::ipc::EncodeFrame(brisvale::ipc::FrameFromMessage(*message));
    }
  }

  brisvale::ipc::MatchingEventForUevent(input);
  return 0;
}
