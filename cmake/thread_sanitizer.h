// Included first in builds with the thread sanitizer. That of g++ 12 does not know the call by which the
// standard library's timed mutexes wait on the monotonic clock, and would take each unlock for that of an
// unlocked mutex; without this the mutexes wait by a call that it knows.
#include <bits/c++config.h>
#undef _GLIBCXX_USE_PTHREAD_MUTEX_CLOCKLOCK
