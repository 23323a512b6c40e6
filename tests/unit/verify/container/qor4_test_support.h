// Shared by the container and disk-image tests: a realistic manifest and container built
// with the DER writer, and a non-allocating stand-in digest.
#pragma once

#include <cstdint>
#include <vector>

#include "derwriter/der_writer.h"
#include "verify/container/qor4.h"

namespace brisvale::testing_support {

using derwriter::Bytes;

inline constexpr uint32_t kPdmg = Qor4Code("pdmg");  // the disk-image object

inline std::vector<Bytes> DefaultManifestProperties() {
  using namespace derwriter;
  return {DataProperty("BNCH", Bytes{1, 2, 3, 4, 5, 6, 7, 8}), IntegerProperty("BORD", 0x10),
          IntegerProperty("CHIP", 0x8020), BooleanProperty("CPRO", true), BooleanProperty("CSEC", false),
          IntegerProperty("ECID", 0x1122334455667788ull), IntegerProperty("SDOM", 1)};
}

inline Bytes DefaultBody() {
  using namespace derwriter;
  return ManifestBody(DefaultManifestProperties(),
                      {{"krnl", {IntegerProperty("ESEC", 1)}},
                       {"pdmg", {DataProperty("DGST", Bytes(48, 0xD5)),
                                 StringProperty("pdnm", "DebugDiskImage"), BooleanProperty("EKEY", true)}}});
}

inline Bytes DefaultManifest(const Bytes& body = DefaultBody()) {
  return derwriter::Manifest(body, Bytes(256, 0x5E), {Bytes{0x30, 0x00}, Bytes{0x30, 0x00}});
}

inline Bytes DefaultContainer() {
  using namespace derwriter;
  return Container(Payload("pdmg", "1.0", Bytes(100, 0xAB), Bytes{9, 9},
                           CompressionInfo{1, 4096}),
                   DefaultManifest(), RestoreInfo({BooleanProperty("RDSK", true)}));
}

// The context points into `bytes`, which must outlive it.
inline int InitContainer(const Bytes& bytes, Qor4DecodeContext* context) {
  return Qor4DecodeInit(bytes.data(), static_cast<uint32_t>(bytes.size()), context);
}

inline int InitManifest(const Bytes& bytes, Qor4DecodeContext* context) {
  *context = Qor4DecodeContext{};
  return Qor4DecodeInitManifest(bytes.data(), static_cast<uint32_t>(bytes.size()), context);
}

// Non-allocating stand-in digest: FNV-1a, its state repeated over the output.
inline int FakeDigest(const uint8_t* data, uint32_t length, uint8_t* output,
                      uint32_t outputLength) {
  uint64_t state = 0xcbf29ce484222325ull;
  for (uint32_t i = 0; i < length; i++) state = (state ^ data[i]) * 0x100000001b3ull;
  for (uint32_t i = 0; i < outputLength; i++) output[i] = static_cast<uint8_t>(state >> (8 * (i % 8)));
  return 0;
}

}  // namespace brisvale::testing_support
