/* A platform library in plain C. RESULT is what its function returns. */
#include <stdbool.h>
#include <sys/stat.h>

RESULT PLATFileExist(const char* path) {
    struct stat info;
    return stat(path, &info) == 0;
}
