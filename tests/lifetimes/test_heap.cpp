#include "test_heap.h"

#include <malloc.h>

#include <cstdlib>
#include <cstring>
#include <new>

namespace {

// Plain data, constant-initialised: usable before any constructor has run.
thread_local std::size_t t_countdown = 0;
thread_local bool t_failed = false;

// True when this allocation is the one the thread asked to fail.
bool fail_now() {
  if (t_countdown == 0 || --t_countdown != 0) return false;
  t_failed = true;
  return true;
}

void* allocate(std::size_t size) {
  if (fail_now()) return nullptr;
  return std::malloc(size == 0 ? 1 : size);
}

void release(void* block) {
  if (block == nullptr) return;
  std::memset(block, 0xDD, _msize(block));
  std::free(block);
}

}  // namespace

namespace test_heap {

void fail_nth(std::size_t n) {
  t_countdown = n;
  t_failed = false;
}

bool failed() { return t_failed; }

}  // namespace test_heap

void* operator new(std::size_t size) {
  if (void* block = allocate(size)) return block;
  throw std::bad_alloc();
}
void* operator new[](std::size_t size) { return operator new(size); }
void* operator new(std::size_t size, const std::nothrow_t&) noexcept { return allocate(size); }
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept { return allocate(size); }
void operator delete(void* block) noexcept { release(block); }
void operator delete[](void* block) noexcept { release(block); }
void operator delete(void* block, std::size_t) noexcept { release(block); }
void operator delete[](void* block, std::size_t) noexcept { release(block); }
void operator delete(void* block, const std::nothrow_t&) noexcept { release(block); }
void operator delete[](void* block, const std::nothrow_t&) noexcept { release(block); }
