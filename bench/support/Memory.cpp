#include "support/Memory.h"

#include <malloc.h>
#include <sys/mman.h>

#include <atomic>
#include <cstdlib>
#include <new>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kPage = 4096;
constexpr std::size_t kLarge = 256U << 10U;

std::atomic<std::size_t> largeAllocations{0};
std::atomic<std::size_t> bytesInUse{0};

void* allocate(std::size_t size) {
  void* const memory = std::malloc(size == 0 ? 1 : size);
  if (memory == nullptr) throw std::bad_alloc();
  bytesInUse.fetch_add(malloc_usable_size(memory) + sizeof(std::size_t), std::memory_order_relaxed);
  if (size >= kLarge) largeAllocations.fetch_add(1, std::memory_order_relaxed);
  return memory;
}

void release(void* memory) noexcept {
  if (memory == nullptr) return;
  bytesInUse.fetch_sub(malloc_usable_size(memory) + sizeof(std::size_t), std::memory_order_relaxed);
  std::free(memory);
}

}  // namespace

void warmMemory(std::size_t bytes) {
  void* const memory = ::mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (memory == MAP_FAILED) return;
  auto* const first = static_cast<volatile unsigned char*>(memory);
  for (std::size_t position = 0; position < bytes; position += kPage) first[position] = 1;
  ::munmap(memory, bytes);
}

Allocations allocations() { return {largeAllocations.load(), bytesInUse.load()}; }

}  // namespace velmora::mobile::xplat::cellar::bench

void* operator new(std::size_t size) { return velmora::mobile::xplat::cellar::bench::allocate(size); }
void* operator new[](std::size_t size) { return velmora::mobile::xplat::cellar::bench::allocate(size); }
void operator delete(void* memory) noexcept { velmora::mobile::xplat::cellar::bench::release(memory); }
void operator delete[](void* memory) noexcept { velmora::mobile::xplat::cellar::bench::release(memory); }
void operator delete(void* memory, std::size_t /*size*/) noexcept {
  velmora::mobile::xplat::cellar::bench::release(memory);
}
void operator delete[](void* memory, std::size_t /*size*/) noexcept {
  velmora::mobile::xplat::cellar::bench::release(memory);
}
