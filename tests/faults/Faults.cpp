#include "Faults.h"

#include "OpenVdbCode.h"
#include "vljemalloc/vljemalloc.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <execinfo.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <new>
#include <pthread.h>

namespace test::faults {

namespace {

constinit std::atomic<bool> g_armed{false};
constinit std::atomic<bool> g_once{true};
constinit std::atomic<std::int64_t> g_target{0}, g_count{0}, g_failures{0}, g_bulkBlocks{0};
std::int64_t g_thrown = 0, g_childTarget = 0;

/// In a process that has just been forked.
void armChild() {
  g_armed = g_childTarget > 0;
  g_once = false, g_target = g_childTarget, g_count = 0;
}
[[maybe_unused]] int const g_atFork = pthread_atfork(nullptr, nullptr, &armChild);

/// That things did fail.
class Counted final : public ::testing::Environment {
public:
  void TearDown() override {
    std::printf("%ld failures were thrown in all\n", long(g_thrown));
    if (::testing::GTEST_FLAG(filter) == "*") { EXPECT_GT(g_thrown, 1000); }
  }
};
[[maybe_unused]] auto* const g_counted = ::testing::AddGlobalTestEnvironment(new Counted);

} // namespace

constinit std::atomic<bool> g_spareOpenVdb{false};
constinit thread_local bool t_looking = false;

OpenVdbCode const& openVdbCode() {
  static OpenVdbCode const code;
  return code;
}
/// Whether a function of OpenVDB's stands on the stack.
bool insideOpenVdb() {
  if (t_looking) return true;
  t_looking = true;
  void* frames[100];
  int const count = backtrace(frames, 100);
  bool const found =
      std::any_of(frames, frames + count, [](void* frame) { return openVdbCode().holds(frame); });
  t_looking = false;
  return found;
}

bool isArmed() { return g_armed.load(std::memory_order_relaxed); }
bool failsNow() {
  if (!isArmed() || (g_spareOpenVdb && insideOpenVdb())) return false;
  std::int64_t const n = g_count.fetch_add(1) + 1;
  bool const fails = g_once ? n == g_target : n >= g_target;
  if (fails) ++g_failures;
  return fails;
}
void countBulk(std::int64_t by) { g_bulkBlocks += by; }

Armed::Armed(std::int64_t n, Mode mode) {
  g_once = mode == Mode::kOnce;
  g_target = n, g_count = 0, g_failures = 0;
  g_armed = true;
}
Armed::~Armed() { g_armed = false; }
OpenVdbSpared::OpenVdbSpared() {
  insideOpenVdb(); // the first look loads what looks
  g_spareOpenVdb = true;
}
OpenVdbSpared::~OpenVdbSpared() { g_spareOpenVdb = false; }
ArmedChildren::ArmedChildren(std::int64_t n) { g_childTarget = n; }
ArmedChildren::~ArmedChildren() { g_childTarget = 0; }
std::int64_t failures() { return g_failures; }
std::int64_t bulkBlocks() { return g_bulkBlocks; }

std::int64_t nextTry(std::int64_t n, int dense) {
  static bool const all = std::getenv("VLN_FAULTS_ALL") != nullptr;
  return all || n < dense ? n + 1 : n + std::max<std::int64_t>(1, 6 * n / dense);
}
void report(char const* name, std::int64_t tries, std::int64_t thrown) {
  std::printf("%s: %ld tries, %ld of them thrown\n", name, long(tries), long(thrown));
  g_thrown += thrown;
}
void expect(bool condition, std::string const& what) { EXPECT_TRUE(condition) << what; }

} // namespace test::faults

// The replacements

namespace {

void* newBlock(std::size_t size, std::size_t alignment) {
  if (test::faults::failsNow()) return nullptr;
  void* p = nullptr;
  return posix_memalign(&p, std::max(alignment, sizeof(void*)), std::max<std::size_t>(size, 1)) == 0
             ? p
             : nullptr;
}
void* newOrThrow(std::size_t size, std::size_t alignment) {
  void* const p = newBlock(size, alignment);
  if (!p) throw std::bad_alloc();
  return p;
}
void* bulkBlock(std::size_t size, std::size_t alignment) {
  void* const p = newBlock(size, alignment);
  if (p) test::faults::countBulk(1);
  return p;
}

} // namespace

void* operator new(std::size_t n) { return newOrThrow(n, alignof(std::max_align_t)); }
void* operator new[](std::size_t n) { return newOrThrow(n, alignof(std::max_align_t)); }
void* operator new(std::size_t n, std::align_val_t a) { return newOrThrow(n, static_cast<std::size_t>(a)); }
void* operator new[](std::size_t n, std::align_val_t a) { return newOrThrow(n, static_cast<std::size_t>(a)); }
void* operator new(std::size_t n, std::nothrow_t const&) noexcept {
  return newBlock(n, alignof(std::max_align_t));
}
void* operator new[](std::size_t n, std::nothrow_t const&) noexcept {
  return newBlock(n, alignof(std::max_align_t));
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete(void* p, std::size_t) noexcept { std::free(p); }
void operator delete[](void* p, std::size_t) noexcept { std::free(p); }
void operator delete(void* p, std::align_val_t) noexcept { std::free(p); }
void operator delete[](void* p, std::align_val_t) noexcept { std::free(p); }
void operator delete(void* p, std::size_t, std::align_val_t) noexcept { std::free(p); }
void operator delete[](void* p, std::size_t, std::align_val_t) noexcept { std::free(p); }

namespace {

/// Whether code lies in this program or in a library of ours. Others call the C library too, and a sanitizer
/// that asks it for a thread's stack may end the process.
bool isOurs(void const* code) {
  Dl_info own, other;
  return dladdr(reinterpret_cast<void*>(&isOurs), &own) && dladdr(code, &other) &&
         (own.dli_fbase == other.dli_fbase || std::strstr(other.dli_fname, "GeometryVolume"));
}
bool callerFails(void const* caller) {
  return test::faults::isArmed() && isOurs(caller) && test::faults::failsNow();
}

} // namespace

// What stands behind these in the process: the C library, or a sanitizer.
extern "C" void* realloc(void* p, size_t size) noexcept {
  using Function = void*(void*, std::size_t);
  static auto* const next = reinterpret_cast<Function*>(dlsym(RTLD_NEXT, "realloc"));
  return callerFails(__builtin_return_address(0)) ? nullptr : next(p, size);
}
extern "C" void* aligned_alloc(size_t alignment, size_t size) noexcept {
  using Function = void*(std::size_t, std::size_t);
  static auto* const next = reinterpret_cast<Function*>(dlsym(RTLD_NEXT, "aligned_alloc"));
  return callerFails(__builtin_return_address(0)) ? nullptr : next(alignment, size);
}

void* vlje_aligned_alloc(size_t alignment, size_t size) { return bulkBlock(size, alignment); }
void* vlje_mallocx(size_t size, int flags) {
  void* const p = bulkBlock(size, std::size_t(1) << (flags & 0x3f));
  if (p && (flags & VLJE_ZERO)) std::memset(p, 0, size);
  return p;
}
size_t vlje_xallocx(void* p, size_t, size_t, int) { return malloc_usable_size(p); }
void vlje_free(void* p) {
  if (p) test::faults::countBulk(-1);
  std::free(p);
}
int vlje_mallctl(const char*, void*, size_t*, void*, size_t) { return ENOENT; }
void vlje_malloc_stats_print(void (*)(void*, const char*), void*, const char*) {}
