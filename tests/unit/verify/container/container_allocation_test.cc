// The DER and container layers never allocate: every allocation made while they decode
// and evaluate is counted, with slot functions that do not allocate either.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <new>

#include "qor4_test_support.h"

namespace {

std::atomic<bool> g_counting{false};
std::atomic<long> g_allocations{0};

void Count() {
  if (g_counting.load(std::memory_order_relaxed)) g_allocations++;
}

}  // namespace

void* operator new(size_t size) {
  Count();
  if (void* p = std::malloc(size ? size : 1)) return p;
  throw std::bad_alloc();
}
void* operator new[](size_t size) { return operator new(size); }
void operator delete(void* p) noexcept { std::free(p); }
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete(void* p, size_t) noexcept { std::free(p); }
void operator delete[](void* p, size_t) noexcept { std::free(p); }

// The C allocator too, except under AddressSanitizer, which owns malloc.
#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define BRISVALE_ASAN 1
#endif
#endif
#if !defined(__SANITIZE_ADDRESS__) && !defined(BRISVALE_ASAN)
extern "C" {
void* __libc_malloc(size_t);
void* __libc_calloc(size_t, size_t);
void* __libc_realloc(void*, size_t);
void __libc_free(void*);
void* malloc(size_t size) {
  Count();
  return __libc_malloc(size);
}
void* calloc(size_t count, size_t size) {
  Count();
  return __libc_calloc(count, size);
}
void* realloc(void* p, size_t size) {
  Count();
  return __libc_realloc(p, size);
}
void free(void* p) { __libc_free(p); }
}
#endif

namespace brisvale {
namespace {

using namespace testing_support;

int AcceptAll(uint32_t, Qor4PropertyRef property, uint32_t, void* context) {
  bool flag;
  uint64_t number;
  const uint8_t* data;
  uint32_t length;
  // Read every value the way the daemon's callback does.
  Qor4DecodeGetPropertyBoolean(&property.encoding, 0, 0, &flag);
  Qor4DecodeGetPropertyInteger64(&property.encoding, 0, 0, &number);
  Qor4DecodeGetPropertyData(&property.encoding, 0, 0, &data, &length);
  ++*static_cast<int*>(context);
  return 0;
}

TEST(NoAllocation, DecodeAndFullEvaluation) {
  Slots() = SlotState{};
  Slots().useRealCertificateEvaluation = true;
  Slots().certificateProperties = derwriter::Set(
      {derwriter::Dictionary("MANP", {derwriter::IntegerProperty("BORD", 0x10)}),
       derwriter::Dictionary("OBJP", {derwriter::BooleanProperty("EKEY", true)})});
  const Bytes container = DefaultContainer();
  int delivered = 0;

  g_allocations = 0;
  g_counting = true;
  Qor4DecodeContext context{};
  const int init = Qor4DecodeInit(container.data(), static_cast<uint32_t>(container.size()), &context);
  const Qor4PropertyCallbacks callbacks = {AcceptAll, nullptr};
  const int evaluation = Qor4DecodePerformTrustEvaluatationWithCallbacks(
      Qor4Code("pdmg"), &context, &callbacks, &kFakeParams, &delivered);
  uint32_t type;
  const int getter = Qor4DecodeGetPayloadType(&context, &type);
  g_counting = false;

  EXPECT_EQ(0, init);
  EXPECT_EQ(0, evaluation);
  EXPECT_EQ(0, getter);
  EXPECT_EQ(10, delivered);
  EXPECT_EQ(1, Slots().certificateCalls);
  EXPECT_EQ(0, g_allocations.load());

  // The counter itself works. A direct call, because a new-expression whose result is
  // unused may be elided (clang does).
  g_counting = true;
  ::operator delete(::operator new(1));
  g_counting = false;
  EXPECT_GE(g_allocations.load(), 1);
}

}  // namespace
}  // namespace brisvale
