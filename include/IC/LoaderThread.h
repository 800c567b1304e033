// IC::LoaderThread: calls a function every few seconds until stopped. A host
// runs one with IC::InstCtrl::TimedReload as its function and stores it in
// IC::InstCtrl::lt; the last unload stops, joins and deletes it.
#pragma once

#include <IC/Export.h>
#include <SD/Event.h>
#include <SD/Thread.h>

#include <atomic>

namespace IC {

class IC_API LoaderThread : public SD::Thread {
public:
    // The first argument is the host's and is only stored. A delay of 0
    // seconds becomes 10 when the thread starts.
    LoaderThread(unsigned int hostValue, unsigned long delay, void (*function)());
    ~LoaderThread() override;

    // Asks the thread to end, then sleeps one second.
    void stop() override;
    void* run(void* arg) override;
    bool stopped() override;

    unsigned int getHostValue() const { return hostValue; }
    unsigned long getDelay() const { return delay.load(); }

private:
    unsigned int hostValue;
    std::atomic<unsigned long> delay;
    void (*function)();
    SD::Event stopEvent;
    std::atomic<bool> stoppedFlag;
};

} // namespace IC
