#include "memory.h"

#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

namespace ternhad {

namespace {

// Unmap the pages of code and constants, which are read from their file again where they are used
// again. Writable segments also hold relocated data and are left alone.
int releaseFilePages(dl_phdr_info* object, std::size_t /*size*/, void* /*data*/) {
    const auto pageMask = ~(static_cast<std::uintptr_t>(sysconf(_SC_PAGESIZE)) - 1);
    for (int i = 0; i < object->dlpi_phnum; ++i) {
        const ElfW(Phdr)& segment = object->dlpi_phdr[i];
        if (segment.p_type == PT_LOAD && (segment.p_flags & PF_W) == 0) {
            const auto begin = (object->dlpi_addr + segment.p_vaddr) & pageMask;
            const auto end = object->dlpi_addr + segment.p_vaddr + segment.p_memsz;
            // NOLINTNEXTLINE(performance-no-int-to-ptr): program headers have addresses as integers
            madvise(reinterpret_cast<void*>(begin), end - begin, MADV_DONTNEED);
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
