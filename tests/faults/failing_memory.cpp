#include "faults/failing_memory.h"

#include <cstdlib>
#include <new>

namespace {

thread_local int countdown = 0;

}  // namespace

// Taken by every library of the process before those of the standard library, whose other forms call these.

void* operator new(std::size_t size) {
    if (countdown > 0 && --countdown == 0) {
        throw std::bad_alloc();
    }
    void* const memory = std::malloc(size == 0 ? 1 : size);
    if (memory == nullptr) {
        throw std::bad_alloc();
    }
    return memory;
}

void operator delete(void* memory) noexcept {
    std::free(memory);
}

void operator delete(void* memory, std::size_t /*size*/) noexcept {
    std::free(memory);
}

namespace test {

FailingMemory::FailingMemory(int number) {
    countdown = number;
}

FailingMemory::~FailingMemory() {
    countdown = 0;
}

bool FailingMemory::hasFailed() const {
    return countdown == 0;
}

}  // namespace test
