#include "support/Memory.h"

#include <malloc.h>
#include <sys/mman.h>

#include <atomic>
#include <cstdlib>
#include <limits>
#include <memory>
#include <new>
#include <vector>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kPage = 4096;
constexpr std::size_t kLarge = 256U << 10U;

std::atomic<bool> isCounting{false};
std::atomic<std::size_t> largeAllocations{0};
std::atomic<std::ptrdiff_t> bytesInUse{0};

// What a piece of memory takes, with the allocator's own word before it.
std::ptrdiff_t bytesOf(void* memory) {
  return static_cast<std::ptrdiff_t>(malloc_usable_size(memory) + sizeof(std::size_t));
}

void* allocate(std::size_t size) {
  void* const memory = std::malloc(size == 0 ? 1 : size);
  if (memory == nullptr) throw std::bad_alloc();
  if (isCounting.load(std::memory_order_relaxed)) {
    bytesInUse.fetch_add(bytesOf(memory), std::memory_order_relaxed);
    if (size >= kLarge) largeAllocations.fetch_add(1, std::memory_order_relaxed);
  }
  return memory;
}

void release(void* memory) noexcept {
  if (memory == nullptr) return;
  if (isCounting.load(std::memory_order_relaxed)) bytesInUse.fetch_sub(bytesOf(memory), std::memory_order_relaxed);
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

void keepMemory(std::size_t bytes) {
  constexpr int largest = 32 << 20;  // that the C library takes
  constexpr std::size_t block = 1U << 20U;
  ::mallopt(M_MMAP_THRESHOLD, largest);
  ::mallopt(M_TRIM_THRESHOLD, std::numeric_limits<int>::max());
  std::vector<std::unique_ptr<unsigned char[]>> blocks;  // NOLINT(modernize-avoid-c-arrays)
  while (blocks.size() * block < bytes) blocks.push_back(std::make_unique<unsigned char[]>(block));
}

CountedAllocations::CountedAllocations() {
  largeAllocations = 0;
  bytesInUse = 0;
  isCounting = true;
}

CountedAllocations::~CountedAllocations() { isCounting = false; }

std::size_t CountedAllocations::large() const { return largeAllocations; }

std::ptrdiff_t CountedAllocations::bytes() const { return bytesInUse; }

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
