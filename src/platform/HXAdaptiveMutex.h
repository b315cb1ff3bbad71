// A mutex for what takes less than a thread needs to fall asleep and wake up.
#pragma once

#include <pthread.h>

// Whoever finds it taken tries again for some microseconds before he sleeps. For std::lock_guard.
class HXAdaptiveMutex {
  public:
    HXAdaptiveMutex() = default;
    HXAdaptiveMutex(const HXAdaptiveMutex &) = delete;
    HXAdaptiveMutex &operator=(const HXAdaptiveMutex &) = delete;
    ~HXAdaptiveMutex() { ::pthread_mutex_destroy(&_mutex); }

    void lock() { ::pthread_mutex_lock(&_mutex); }
    void unlock() { ::pthread_mutex_unlock(&_mutex); }

  private:
#ifdef PTHREAD_ADAPTIVE_MUTEX_INITIALIZER_NP // a kind of the GNU C library's
    pthread_mutex_t _mutex = PTHREAD_ADAPTIVE_MUTEX_INITIALIZER_NP;
#else
    pthread_mutex_t _mutex = PTHREAD_MUTEX_INITIALIZER;
#endif
};
