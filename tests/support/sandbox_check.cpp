#include "support/sandbox_check.h"

#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cstdio>

namespace test {
namespace {

constexpr int OUTSIDE_EXIT = 99;

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

void requireSandbox() {
    if (access("/.ternha-sandbox", F_OK) != 0 || !isRootTmpfs() || !sharesMountsWithInit()) {
        std::fputs("refusing to run outside the sandbox: start this program with script/sandbox\n", stderr);
        std::fflush(nullptr);
        _exit(OUTSIDE_EXIT);
    }
}

}  // namespace test
