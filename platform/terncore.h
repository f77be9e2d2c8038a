#pragma once

#include <stdbool.h>  // NOLINT(modernize-deprecated-headers): for C, too
#include <stdio.h>    // NOLINT(modernize-deprecated-headers)

// The functions used of the appliance's core platform library, libterncore.so.6. terncore.cpp
// implements them for other machines.
//
// Every function may be called from any thread. No function throws.
//
// A started program has the caller's environment, working directory and standard descriptors, apart
// from the one that a stream takes, and nothing else of the caller: no further descriptor, no
// blocked and no ignored signal. It must be an executable regular file. Waits continue after an
// interruption. The caller must not ignore SIGCHLD nor reap processes that it did not start,
// otherwise the status of a program is lost and waiting for it fails.

#ifdef __cplusplus
extern "C" {
#endif

// Runs the program at `path` with the null-terminated argument vector `argv` (argv[0] included); no
// shell. With `wait` other than 0 it returns after the program has ended: 0 when that exited with
// status 0, non-zero when it exited otherwise, was ended by a signal or could not be started. With
// `wait` 0 it returns as soon as the program runs: 0 when it was started, non-zero otherwise; the
// system reaps the program.
int PLATExecv(const char* path, const char* const argv[], int wait);

// Runs the program at `path`, which is also its argv[0], with the `const char*` arguments that
// follow, up to a null pointer, and waits for its end. Returns 0 exactly when it exited with status
// 0.
int PLATExec(const char* path, ...);

// Starts the program at `path` with the null-terminated argument vector `argv`, no shell, and
// returns a stream from its standard output (`mode` "r") or to its standard input ("w"). Returns
// null, with errno set, when the program cannot be started or `mode` is another one. The caller
// closes the stream with PLATPclose.
FILE* PLATPopenv(const char* path, const char* mode, const char* const argv[]);

// Closes a stream of PLATPopenv and waits, for as long as it takes, for its program. Returns the
// wait status as waitpid gives it, -1 for a stream that PLATPopenv did not open.
int PLATPclose(FILE* stream);

// Copies the value of `key` in the key-value file `file` into `value`, `size` bytes, always
// terminated when `size` is at least 1 (empty unless the result is 1); a longer value is truncated.
// Lines are key=value or key="value" and end with a line feed, also after a carriage return; blanks
// around key and value, empty lines and lines that begin with '#' are ignored; the first line with
// the key counts, and its value may be empty. `flags` must be 0. Returns 1 on success, 0 when the
// key is missing, -1 when the file cannot be read or an argument is invalid.
int PLATFileGetKeyValue(const char* file, const char* key, char* value, int size, int flags);

// True when something exists at `path` (links are followed).
bool PLATFileExist(const char* path);

// Writes the block device name (such as sda) of the disk on the ATA port `port` (such as ata3) into
// `name`, `size` bytes, terminated. Optical drives are no disks; of several disks on a port the
// first by name counts. Returns 0 on success, -1 when the port has no disk, the name does not fit
// or an argument is invalid; `name` is unchanged then.
int TERNDiskGetDevnamebyAtaPort(char* name, int size, const char* port);

#ifdef __cplusplus
}
#endif
