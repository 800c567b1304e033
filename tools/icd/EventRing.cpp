#include "EventRing.h"

namespace icd {

EventRing::EventRing(std::size_t capacity) : capacity_(capacity == 0 ? 1 : capacity) {}

std::uint64_t EventRing::push(std::string data)
{
    std::uint64_t id;
    {
        std::lock_guard<std::mutex> g(lock_);
        id = ++lastId_;
        if (events_.size() == capacity_)
            events_.pop_front();
        events_.push_back(Event{id, std::make_shared<std::string const>(std::move(data))});
    }
    arrived_.notify_all();
    return id;
}

bool EventRing::readAfter(std::uint64_t after, std::chrono::milliseconds wait,
                          std::vector<Event>& out, std::uint64_t* missed)
{
    out.clear();
    *missed = 0;
    std::unique_lock<std::mutex> g(lock_);
    arrived_.wait_for(g, wait, [&] { return closed_ || lastId_ > after; });
    if (closed_)
        return false;
    if (events_.empty() || lastId_ <= after)
        return true;
    std::uint64_t const first = events_.front().id;
    if (after + 1 < first)
        *missed = first - after - 1;
    std::size_t const skip = after < first ? 0 : static_cast<std::size_t>(after + 1 - first);
    out.assign(events_.begin() + static_cast<std::ptrdiff_t>(skip), events_.end());
    return true;
}

void EventRing::close()
{
    {
        std::lock_guard<std::mutex> g(lock_);
        closed_ = true;
    }
    arrived_.notify_all();
}

std::uint64_t EventRing::lastId() const
{
    std::lock_guard<std::mutex> g(lock_);
    return lastId_;
}

} // namespace icd
