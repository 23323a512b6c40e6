// Any bytes: the binary reader refuses them or returns a value that reads back equal
// after a binary write, and that the XML writer turns into a readable document.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "base/plist.h"
#include "plist_fuzz_util.h"

using namespace brisvale::plist;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::optional<Value> value = ReadBinary({data, size});
  if (!value) return 0;
  (void)value->description();
  std::optional<Value> again = ReadBinary(WriteBinary(*value));
  if (!again || (!HasNaN(*value) && !(*again == *value))) std::abort();
  // Dates lose their fractions and control characters are replaced in XML, so only
  // readability is required there; keys that differ only in such characters collide.
  std::string error;
  if (!ReadXml(AsBytes(WriteXml(*value)), &error) && error != "duplicate dictionary key") {
    std::abort();
  }
  return 0;
}
