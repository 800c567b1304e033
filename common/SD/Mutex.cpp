#include <SD/Mutex.h>

#include <cerrno>
#include <ctime>
#include <system_error>

namespace SD {

Mutex::Mutex()
{
    pthread_mutexattr_t attr;
    pthread_mutexattr_init(&attr);
    pthread_mutexattr_settype(&attr, PTHREAD_MUTEX_RECURSIVE);
    int const rc = pthread_mutex_init(&m_, &attr);
    pthread_mutexattr_destroy(&attr);
    if (rc != 0)
        throw std::system_error(rc, std::generic_category(), "SD::Mutex");
}

Mutex::~Mutex()
{
    pthread_mutex_destroy(&m_);
}

int Mutex::lock(unsigned long timeout)
{
    if (timeout == INFINITE_WAIT)
        return pthread_mutex_lock(&m_) == 0 ? 0 : 1;
    timespec deadline{};
    clock_gettime(CLOCK_REALTIME, &deadline);
    deadline.tv_sec += static_cast<time_t>(timeout / 1000);
    deadline.tv_nsec += static_cast<long>(timeout % 1000) * 1000000L;
    if (deadline.tv_nsec >= 1000000000L) {
        deadline.tv_sec += 1;
        deadline.tv_nsec -= 1000000000L;
    }
    int rc;
    do {
        rc = pthread_mutex_timedlock(&m_, &deadline);
    } while (rc == EINTR);
    return rc == 0 ? 0 : 1;
}

bool Mutex::try_lock()
{
    return pthread_mutex_trylock(&m_) == 0;
}

void Mutex::unlock()
{
    pthread_mutex_unlock(&m_);
}

} // namespace SD
