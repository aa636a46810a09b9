// In a source of its own: where the compiler sees through a replaced operator new, it warns of
// mismatches.
#include <atomic>
#include <cstdlib>
#include <new>

#include "bench/messages/contests.h"

namespace {

std::atomic<size_t> allocations{0};

}  // namespace

void* operator new(size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    if (void* memory = malloc(size)) {
        return memory;
    }
    throw std::bad_alloc();
}

void operator delete(void* memory) noexcept {
    free(memory);
}

void operator delete(void* memory, size_t) noexcept {
    free(memory);
}

size_t bench::Allocations() {
    return allocations;
}
