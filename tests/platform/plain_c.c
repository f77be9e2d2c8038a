/* A platform library in plain C. RESULT is what its functions that tell true from false return. */
#include <stdarg.h>
#include <stdbool.h>
#include <string.h>
#include <sys/stat.h>

RESULT PLATFileExist(const char* path) {
    struct stat info;
    return stat(path, &info) == 0;
}

/* Succeeds with one argument and two closing nulls. */
int PLATExec(const char* path, ...) {
    va_list arguments;
    va_start(arguments, path);
    const char* const only = va_arg(arguments, const char*);
    const char* const end = va_arg(arguments, const char*);
    const char* const secondEnd = va_arg(arguments, const char*);
    va_end(arguments);
    return strcmp(only, "--local-has-constraint") == 0 && end == NULL && secondEnd == NULL ? 0 : 1;
}
