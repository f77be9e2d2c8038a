// Included first in builds with the thread sanitizer. That of g++ 12 does not intercept
// pthread_mutex_clocklock, which timed mutexes call to wait on the monotonic clock, and would report
// each unlock. Without the macro they call pthread_mutex_timedlock.
#include <bits/c++config.h>
#undef _GLIBCXX_USE_PTHREAD_MUTEX_CLOCKLOCK
