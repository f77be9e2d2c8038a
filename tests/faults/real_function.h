#pragma once

#include <dlfcn.h>

namespace test {

// The C library's own function, for a test that puts one of the same name in front of it. With 64-bit time on
// 32 bits some have another name.
template <class Function>
Function* realFunction(const char* name, const char* nameWith64BitTime = nullptr) {
    void* symbol = nullptr;
    if (sizeof(void*) == 4 && nameWith64BitTime != nullptr) {
        symbol = dlsym(RTLD_NEXT, nameWith64BitTime);
    }
    if (symbol == nullptr) {
        symbol = dlsym(RTLD_NEXT, name);
    }
    return reinterpret_cast<Function*>(symbol);
}

}  // namespace test
