// The alerts as they arrived, for the event stream: the library's callback
// pushes (never waiting on a client), each subscriber's own thread reads
// what follows the last event it sent. Bounded: the oldest events go first.
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

class EventRing {
public:
    explicit EventRing(std::size_t capacity);

    // Appends an event and wakes the readers; returns its id (1, 2, ...).
    std::uint64_t push(std::string data);

    // The events after id `after` still held, waiting up to `wait` for one to
    // arrive. missed tells how many after `after` were already dropped. Returns
    // false once the ring is closed.
    bool readAfter(std::uint64_t after, std::chrono::milliseconds wait, std::vector<Event>& out,
                   std::uint64_t* missed);

    // Ends every wait; readers return false from then on.
    void close();

    std::uint64_t lastId() const;
    std::size_t capacity() const { return capacity_; }

private:
    std::size_t const capacity_;
    mutable std::mutex lock_;
    std::condition_variable arrived_;
    std::deque<Event> events_;
    std::uint64_t lastId_ = 0;
    bool closed_ = false;
};

} // namespace icd
