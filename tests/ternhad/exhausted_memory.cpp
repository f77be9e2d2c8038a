#include <unistd.h>

#include <cstdlib>
#include <new>

// Preloaded into a daemon: there is no memory for it while a file of this name exists.

void* operator new(std::size_t size) {
    void* const memory = access("/tmp/no-memory", F_OK) == 0 ? nullptr : std::malloc(size == 0 ? 1 : size);
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
