// SD::Thread: base of a worker thread. A subclass overrides run(); a host
// starts it with start(), asks it to end with stop() and waits with join().
// The owner must join the thread before destroying the object.
#pragma once

#include <IC/CommonExport.h>

#include <atomic>
#include <mutex>
#include <thread>

namespace SD {

class ICCOMMON_API Thread {
public:
    Thread();
    virtual ~Thread();
    Thread(Thread const&) = delete;
    Thread& operator=(Thread const&) = delete;

    // Asks the thread to end; the base does nothing.
    virtual void stop();
    // The thread body; its argument is the one given to start().
    virtual void* run(void* arg) = 0;
    // True once the thread body has ended; the base tracks run() itself.
    virtual bool stopped();

    // Starts run(arg) on a new thread. Returns false when the thread is
    // already started or cannot be created.
    bool start(void* arg = nullptr);
    // Waits until run() has returned. Returns false when the thread was never
    // started, was already joined, or join() is called from the thread itself.
    bool join();
    // True between start() and the end of run().
    bool isRunning() const { return running_.load(); }

    static void sleep(unsigned int seconds);
    static void sleepMilliseconds(unsigned int milliseconds);

private:
    std::mutex m_; // guards thread_
    std::thread thread_;
    std::atomic<bool> running_{false};
    std::atomic<bool> ended_{false};
};

} // namespace SD
