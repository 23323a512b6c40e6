// Any bytes: the XML reader refuses them or returns a value that reads back equal
// after a write in either format.
#include <cstdint>
#include <cstdlib>

#include "base/plist.h"
#include "plist_fuzz_util.h"

using namespace brisvale::plist;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::optional<Value> value = ReadXml({data, size});
  if (!value) return 0;
  (void)value->description();
  const bool comparable = !HasNaN(*value);
  std::optional<Value> viaXml = ReadXml(AsBytes(WriteXml(*value)));
  std::optional<Value> viaBinary = ReadBinary(WriteBinary(*value));
  if (!viaXml || !viaBinary) std::abort();
  if (comparable && (!(*viaXml == *value) || !(*viaBinary == *value))) std::abort();
  return 0;
}
