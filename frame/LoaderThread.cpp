#include <IC/LoaderThread.h>

#include <HGLog/HGLogger.h>

#include <string>

namespace IC {
namespace LOADER_THREAD {

// Private to the library.
std::string loggerLoaderThread = "Helmgard.IC.InstrumentationControl.LoaderThread";

} // namespace LOADER_THREAD

#define LT_LOG(level, ...) \
    HGLOG_EVENT("LoaderThread", LOADER_THREAD::loggerLoaderThread, level, __VA_ARGS__)

LoaderThread::LoaderThread(unsigned int hostValue, unsigned long delay, void (*function)())
    : SD::Thread(), hostValue(hostValue), delay(delay), function(function), stopEvent(true),
      stoppedFlag(false)
{
}

LoaderThread::~LoaderThread() = default;

void LoaderThread::stop()
{
    stopEvent.signal();
    SD::Thread::sleep(1);
}

bool LoaderThread::stopped()
{
    return stoppedFlag.load();
}

void* LoaderThread::run(void*)
{
    if (stoppedFlag.load())
        return nullptr;
    if (delay.load() == 0) {
        delay = 10;
        LT_LOG(6000, "LoaderThread has zero delay. Setting ", delay.load(), " seconds instead");
    }
    // A stop request is seen at the next wake-up: at once while waiting,
    // after the function returns while it runs.
    bool quit = false;
    while (!stopEvent.test() && !quit) {
        for (;;) {
            int const signal = stopEvent.wait(delay.load());
            if (signal == 0) {
                quit = true;
                break;
            }
            if (signal != 1) {
                LT_LOG(6000, "LoaderThread got error signal=", signal);
                quit = true;
                break;
            }
            if (!function)
                break;
            function();
            if (stopEvent.test()) {
                quit = true;
                break;
            }
        }
    }
    stoppedFlag = true;
    return nullptr;
}

} // namespace IC
