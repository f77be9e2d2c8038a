#include "faults/failing_memory.h"

#include <dlfcn.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <new>

#include "faults/real_function.h"

namespace {

thread_local int countdown = 0;

// For programs that preload this file: allocation fails while the file of this name exists.
const char* const EXHAUSTED_WHILE = std::getenv("NO_MEMORY_WHILE");

bool fails() {
    if (countdown > 0) {
        --countdown;
        if (countdown == 0) {
            return true;
        }
    }
    return EXHAUSTED_WHILE != nullptr && access(EXHAUSTED_WHILE, F_OK) == 0;
}

}  // namespace

// Interposed for every library of the process; the other forms of operator new call these.

void* operator new(std::size_t size) {
    void* const memory = fails() ? nullptr : std::malloc(size == 0 ? 1 : size);
    if (memory == nullptr) {
        throw std::bad_alloc();
    }
    return memory;
}

// As in the C++ library, whose own valgrind replaces.
void* operator new(std::size_t size, const std::nothrow_t& /*nothrow*/) noexcept {
    try {
        return operator new(size);
    } catch (const std::bad_alloc&) {
        return nullptr;
    }
}

void operator delete(void* memory) noexcept {
    std::free(memory);
}

void operator delete(void* memory, std::size_t /*size*/) noexcept {
    std::free(memory);
}

// jsoncpp allocates strings with malloc, which sanitizers interpose themselves.
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
extern "C" void* malloc(std::size_t size) {
    static auto* const real = test::realFunction<void*(std::size_t)>("malloc");
    Dl_info caller = {};
    if (countdown > 0 && dladdr(__builtin_return_address(0), &caller) != 0 &&
        std::strstr(caller.dli_fname, "libjsoncpp") != nullptr && fails()) {
        return nullptr;
    }
    return real(size);
}
#endif

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
