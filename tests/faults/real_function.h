#pragma once

#include <dlfcn.h>

namespace test {

// Return the C library's function of a name that a test interposes. Some have another name with
// 64-bit time on 32-bit machines.
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
