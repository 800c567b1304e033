// The alerts as they arrived, for the event stream: the library's callback
// pushes (never waiting on a client); readers take what follows the last
// event they sent. Bounded: the oldest events go first.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace icd {

struct Event {
    std::uint64_t id;
    std::shared_ptr<std::string const> data; // one JSON line, shared by every reader
};

// Wakes whoever waits on the eventfd fd (when fd >= 0); a full counter
// means a wake-up is pending anyway.
void signalEventFd(int fd);
// Takes the wake-ups pending on the eventfd fd.
void drainEventFd(int fd);

// The event-stream text of these events, preceded by a comment when `missed`
// earlier ones were dropped.
void appendEventText(std::string& out, std::vector<Event> const& events, std::uint64_t missed);

class EventRing {
public:
    explicit EventRing(std::size_t capacity);
    ~EventRing();
    EventRing(EventRing const&) = delete;
    EventRing& operator=(EventRing const&) = delete;

    // Appends an event and wakes the readers; returns its id (1, 2, ...).
    std::uint64_t push(std::string data);

    // The events after id `after` still held, waiting up to `wait` for one to
    // arrive. missed tells how many after `after` were already dropped. Returns
    // false once the ring is closed.
    bool readAfter(std::uint64_t after, std::chrono::milliseconds wait, std::vector<Event>& out,
                   std::uint64_t* missed);
    // The same without waiting.
    bool collect(std::uint64_t after, std::vector<Event>& out, std::uint64_t* missed) const;

    // An eventfd that turns readable on every push and on close, for a
    // reader that waits on sockets too.
    int wakeFd() const { return wake_; }

    // Ends every wait; readers return false from then on.
    void close();

    std::uint64_t lastId() const;
    bool closed() const;
    std::size_t capacity() const { return capacity_; }

private:
    bool collectLocked(std::uint64_t after, std::vector<Event>& out, std::uint64_t* missed) const;

    std::size_t const capacity_;
    int const wake_;
    mutable std::mutex lock_;
    std::condition_variable arrived_;
    std::deque<Event> events_;
    std::uint64_t lastId_ = 0;
    bool closed_ = false;
};

} // namespace icd
