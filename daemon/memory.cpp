#include "memory.h"

#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

namespace ternhad {

namespace {

void* addressOf(const dl_phdr_info& object, std::uintptr_t offset) {
    // NOLINTNEXTLINE(performance-no-int-to-ptr): program headers have addresses as integers
    return reinterpret_cast<void*>(object.dlpi_addr + offset);
}

// Return true if the code of an object was changed when it was loaded.
bool isCodeRelocated(const dl_phdr_info& object) {
    for (int i = 0; i < object.dlpi_phnum; ++i) {
        if (object.dlpi_phdr[i].p_type != PT_DYNAMIC) {
            continue;
        }
        const auto* entry = static_cast<const ElfW(Dyn)*>(addressOf(object, object.dlpi_phdr[i].p_vaddr));
        for (; entry->d_tag != DT_NULL; ++entry) {
            if (entry->d_tag == DT_TEXTREL ||
                (entry->d_tag == DT_FLAGS && (entry->d_un.d_val & DF_TEXTREL) != 0)) {
                return true;
            }
        }
    }
    return false;
}

// Unmap the pages of code and constants, which are read from their file again where they are used
// again. Writable segments also hold relocated data and are left alone.
int releaseFilePages(dl_phdr_info* object, std::size_t /*size*/, void* /*data*/) {
    if (isCodeRelocated(*object)) {
        return 0;
    }
    const auto pageMask = ~(static_cast<std::uintptr_t>(sysconf(_SC_PAGESIZE)) - 1);
    for (int i = 0; i < object->dlpi_phnum; ++i) {
        const ElfW(Phdr)& segment = object->dlpi_phdr[i];
        if (segment.p_type == PT_LOAD && (segment.p_flags & PF_W) == 0) {
            const auto begin = (object->dlpi_addr + segment.p_vaddr) & pageMask;
            const auto end = object->dlpi_addr + segment.p_vaddr + segment.p_memsz;
            madvise(addressOf(*object, begin - object->dlpi_addr), end - begin, MADV_DONTNEED);
        }
    }
    return 0;
}

}  // namespace

void lockUsedMemory() noexcept {
    dl_iterate_phdr(releaseFilePages, nullptr);
    mlockall(MCL_CURRENT | MCL_ONFAULT);
}

}  // namespace ternhad
