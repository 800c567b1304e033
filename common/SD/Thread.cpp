#include <SD/Thread.h>

#include <chrono>
#include <system_error>

namespace SD {

Thread::Thread() = default;

Thread::~Thread()
{
    // The owner joins before destroying; this only keeps a forgotten join
    // from ending the process in std::thread's destructor.
    std::thread t;
    {
        std::lock_guard<std::mutex> g(m_);
        t = std::move(thread_);
    }
    if (!t.joinable())
        return;
    if (t.get_id() == std::this_thread::get_id())
        t.detach(); // destroyed from its own body: joining itself would throw
    else
        t.join();
}

void Thread::stop() {}

bool Thread::stopped()
{
    return ended_.load();
}

bool Thread::start(void* arg)
{
    std::lock_guard<std::mutex> g(m_);
    if (thread_.joinable() || running_.load())
        return false;
    ended_ = false;
    // Set before the thread exists so that isRunning() holds as soon as
    // start() returns, even if run() has not been entered yet.
    running_ = true;
    try {
        thread_ = std::thread([this, arg] {
            run(arg);
            ended_ = true;
            running_ = false;
        });
    } catch (std::system_error const&) {
        running_ = false;
        return false;
    }
    return true;
}

bool Thread::join()
{
    std::thread t;
    {
        std::lock_guard<std::mutex> g(m_);
        if (!thread_.joinable() || thread_.get_id() == std::this_thread::get_id())
            return false;
        // Taken out so that the wait happens without the lock: run() may call
        // join() or start() itself, and must get its answer, not a deadlock.
        t = std::move(thread_);
    }
    t.join();
    return true;
}

void Thread::sleep(unsigned int seconds)
{
    std::this_thread::sleep_for(std::chrono::seconds(seconds));
}

void Thread::sleepMilliseconds(unsigned int milliseconds)
{
    std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds));
}

} // namespace SD
