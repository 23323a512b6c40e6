// Feeds an alert agent's answer to the daemon's reader in pieces whose sizes the input
// chooses (the first byte), the way recv() hands them over, and checks that a decision,
// once made, never changes however many bytes follow.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>

#include "platform/linux/alert_protocol.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const size_t piece = data[0] % 16 + 1;
  std::span<const uint8_t> input(data + 1, size - 1);

  brisvale::alert::AnswerReader reader;
  std::optional<brisvale::alert::Answer> decided;
  while (!input.empty()) {
    const size_t take = std::min(piece, input.size());
    brisvale::alert::Answer answer = reader.Feed(input.first(take));
    input = input.subspan(take);
    if (decided && (answer.state != decided->state || answer.flags != decided->flags)) abort();
    if (answer.state != brisvale::alert::Answer::State::Incomplete) decided = answer;
  }
  return 0;
}
