#pragma once

#ifdef __linux__
#include <pthread.h>
#endif

namespace capture {

// Names the calling thread where the system keeps thread names, so per-thread figures (top -H,
// /proc) can tell the add-on's threads apart. Threads a library starts from it inherit the name.
inline void nameThread(const char* name) {
#ifdef __linux__
  pthread_setname_np(pthread_self(), name);
#else
  (void)name;
#endif
}

}  // namespace capture
