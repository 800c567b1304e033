// SD::Event: a flag that threads can wait for.
#pragma once

#include <IC/CommonExport.h>

#include <condition_variable>
#include <mutex>

namespace SD {

class ICCOMMON_API Event {
public:
    // A manual-reset event stays signalled until reset(); an auto-reset event
    // is consumed by the wait() that observes it.
    explicit Event(bool manualReset = true);
    ~Event();
    Event(Event const&) = delete;
    Event& operator=(Event const&) = delete;

    void signal();
    void reset();
    // True when signalled; never waits and never consumes the signal.
    bool test();
    // Waits at most the given number of seconds (0xFFFFFFFF: no limit).
    // Returns 0 when signalled, 1 when the time ran out.
    int wait(unsigned long seconds);
    // The same with a limit in milliseconds.
    int waitMilliseconds(unsigned long milliseconds);

private:
    bool manualReset_;
    bool signalled_;
    std::mutex m_;
    std::condition_variable cv_;
};

} // namespace SD
