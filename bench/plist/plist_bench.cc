// Encoding and decoding a device-list reply: {"Status", "EntryList": 1000 entries of ten
// keys}, in both formats. Throughput is in bytes of the encoded document.
#include <benchmark/benchmark.h>

#include <string>

#include "base/plist.h"

namespace brisvale::plist {
namespace {

Value Reply() {
  Array entries;
  for (int i = 0; i < 1000; ++i) {
    Bytes signature(20 + i % 21);
    for (size_t j = 0; j < signature.size(); ++j) signature[j] = static_cast<uint8_t>(i * 31 + j);
    entries.push_back(Value(Dictionary{
        {"DeviceType", Value(i % 3 == 0 ? "DiskImage" : "MassStorage")},
        {"DeviceNode", Value("/dev/disk" + std::to_string(i) + "s1")},
        {"MountPath", Value("/var/mnt/volume-" + std::to_string(i))},
        {"FilesystemType", Value(i % 2 ? "msdos" : "hfs")},
        {"IsMounted", Value::Bool(i % 4 != 0)},
        {"IsReadOnly", Value::Bool(i % 3 == 0)},
        {"SupportsContentProtection", Value::Bool(false)},
        {"DiskImageType", Value("Developer")},
        {"ImageSignature", Value(std::move(signature))},
        {"LocationID", Value::Int(0x14200000 + i * 0x100)},
    }));
  }
  return Value(Dictionary{{"Status", Value("Success")}, {"EntryList", Value(std::move(entries))}});
}

void EncodeBinary(benchmark::State& state) {
  const Value reply = Reply();
  size_t size = 0;
  for (auto _ : state) {
    Bytes bytes = WriteBinary(reply);
    size = bytes.size();
    benchmark::DoNotOptimize(bytes.data());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * size));
}

void DecodeBinary(benchmark::State& state) {
  const Bytes bytes = WriteBinary(Reply());
  for (auto _ : state) {
    std::optional<Value> value = ReadBinary(bytes);
    if (!value) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes.size()));
}

void EncodeXml(benchmark::State& state) {
  const Value reply = Reply();
  size_t size = 0;
  for (auto _ : state) {
    std::string text = WriteXml(reply);
    size = text.size();
    benchmark::DoNotOptimize(text.data());
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * size));
}

void DecodeXml(benchmark::State& state) {
  const std::string text = WriteXml(Reply());
  const std::span<const uint8_t> bytes(reinterpret_cast<const uint8_t*>(text.data()), text.size());
  for (auto _ : state) {
    std::optional<Value> value = ReadXml(bytes);
    if (!value) state.SkipWithError("decode failed");
    benchmark::DoNotOptimize(value);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}

BENCHMARK(EncodeBinary)->Unit(benchmark::kMicrosecond);
BENCHMARK(DecodeBinary)->Unit(benchmark::kMicrosecond);
BENCHMARK(EncodeXml)->Unit(benchmark::kMicrosecond);
BENCHMARK(DecodeXml)->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace brisvale::plist
