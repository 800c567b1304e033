// SD::Mutex: a recursive mutex whose owner may lock it again, with an
// optional time limit. Lock it through SD::MutexGuard so that every exit
// path releases it.
#pragma once

#include <IC/CommonExport.h>

#include <mutex>

#include <pthread.h>

namespace SD {

class ICCOMMON_API Mutex {
public:
    // Passed as the time-out, waits without limit.
    static constexpr unsigned long INFINITE_WAIT = 0xFFFFFFFFUL;

    Mutex();
    ~Mutex();
    Mutex(Mutex const&) = delete;
    Mutex& operator=(Mutex const&) = delete;

    // Waits at most timeout milliseconds (INFINITE_WAIT: no limit).
    // Returns 0 when the lock is held, 1 when the time ran out.
    int lock(unsigned long timeout = INFINITE_WAIT);
    // Returns true when the lock was taken without waiting.
    bool try_lock();
    void unlock();

private:
    // A recursive pthread mutex: its timed lock is one that thread checkers
    // understand (std::recursive_timed_mutex may use pthread_mutex_clocklock,
    // which they do not track).
    pthread_mutex_t m_;
};

// Takes the mutex without limit for the life of the guard.
using MutexGuard = std::lock_guard<Mutex>;

} // namespace SD
