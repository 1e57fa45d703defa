// Counting replacements of the global allocation functions (the aligned
// forms stay with the runtime).  Blocks come from malloc, so a sanitizer
// still pairs them; the release stays out of line so that the compiler does
// not pair a new-expression with free().

#include "support/allocation_count.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace {
std::atomic<long> g_allocations{0};
[[gnu::noinline]] void Release(void* block) noexcept { std::free(block); }
}  // namespace

void* operator new(std::size_t size) {
  g_allocations.fetch_add(1, std::memory_order_relaxed);
  if (void* block = std::malloc(size == 0 ? 1 : size)) return block;
  throw std::bad_alloc();
}
void operator delete(void* block) noexcept { Release(block); }
void operator delete(void* block, std::size_t) noexcept { Release(block); }

namespace zorv_test {
long Allocations() { return g_allocations.load(std::memory_order_relaxed); }
}  // namespace zorv_test
