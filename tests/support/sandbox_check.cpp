#include "support/sandbox_check.h"

#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cstdio>

namespace test {
namespace {

constexpr int kOutsideExit = 99;

bool sharesMountsWithInit() {
    struct stat own = {};
    struct stat init = {};
    return stat("/proc/self/ns/mnt", &own) == 0 && stat("/proc/1/ns/mnt", &init) == 0 &&
           own.st_dev == init.st_dev && own.st_ino == init.st_ino;
}

bool isRootTmpfs() {
    struct statfs root = {};
    return statfs("/", &root) == 0 && root.f_type == TMPFS_MAGIC;
}

}  // namespace

bool insideSandbox() {
    return access("/.ternha-sandbox", F_OK) == 0 && isRootTmpfs() && sharesMountsWithInit();
}

void requireSandbox() {
    if (!insideSandbox()) {
        std::fputs("refusing to run outside the sandbox: start this program with ternha-sandbox\n", stderr);
        std::fflush(nullptr);
        _exit(kOutsideExit);
    }
}

}  // namespace test
