#include <SD/Event.h>

#include <chrono>

namespace SD {

namespace {

using Clock = std::chrono::steady_clock;

// The value of a limit that means "wait without limit".
constexpr unsigned long NO_LIMIT = 0xFFFFFFFFUL;

// The deadline count units from now. Returns false when the limit means no
// limit or is so far off that the clock cannot express it (unsigned long
// counts can exceed what a steady_clock duration holds): both waits are
// unbounded for any practical purpose.
bool deadlineAfter(unsigned long count, Clock::duration unit, Clock::time_point& deadline)
{
    if (count == NO_LIMIT)
        return false;
    Clock::time_point const now = Clock::now();
    Clock::rep const room = (Clock::time_point::max() - now) / unit;
    // Compared in the wider type: on 32-bit targets room exceeds any count.
    if (room <= 0 || static_cast<unsigned long long>(count) >= static_cast<unsigned long long>(room))
        return false;
    deadline = now + unit * static_cast<Clock::rep>(count);
    return true;
}

// The wait shared by both units: 0 when the flag was seen set (and consumed
// for an auto-reset event), 1 when the limit passed first. The predicate
// form absorbs spurious wake-ups.
int waitOn(std::mutex& m, std::condition_variable& cv, bool& signalled, bool manualReset,
           unsigned long count, Clock::duration unit)
{
    Clock::time_point deadline;
    bool const limited = deadlineAfter(count, unit, deadline);
    std::unique_lock<std::mutex> lk(m);
    auto const isSignalled = [&signalled] { return signalled; };
    if (limited) {
        if (!cv.wait_until(lk, deadline, isSignalled))
            return 1;
    } else {
        cv.wait(lk, isSignalled);
    }
    if (!manualReset)
        signalled = false;
    return 0;
}

} // namespace

Event::Event(bool manualReset) : manualReset_(manualReset), signalled_(false) {}

Event::~Event() = default;

void Event::signal()
{
    std::lock_guard<std::mutex> g(m_);
    signalled_ = true;
    // Every waiter re-checks the flag under the lock, so waking them all is
    // safe for an auto-reset event too: only the first one consumes it.
    // Notifying under the lock keeps a waiter that returns at once from
    // destroying the event while it is still being notified.
    cv_.notify_all();
}

void Event::reset()
{
    std::lock_guard<std::mutex> g(m_);
    signalled_ = false;
}

bool Event::test()
{
    std::lock_guard<std::mutex> g(m_);
    return signalled_;
}

int Event::wait(unsigned long seconds)
{
    return waitOn(m_, cv_, signalled_, manualReset_, seconds, std::chrono::seconds(1));
}

int Event::waitMilliseconds(unsigned long milliseconds)
{
    return waitOn(m_, cv_, signalled_, manualReset_, milliseconds, std::chrono::milliseconds(1));
}

} // namespace SD
