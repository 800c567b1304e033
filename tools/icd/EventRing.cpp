#include "EventRing.h"

#include <sys/eventfd.h>
#include <unistd.h>

namespace icd {

void signalEventFd(int fd)
{
    std::uint64_t const one = 1;
    if (fd >= 0 && ::write(fd, &one, sizeof one) < 0) {
        // EAGAIN only: the counter is full, a wake-up is pending.
    }
}

void drainEventFd(int fd)
{
    std::uint64_t pending;
    if (::read(fd, &pending, sizeof pending) < 0) {
        // EAGAIN: another pass took them already.
    }
}

void appendEventText(std::string& out, std::vector<Event> const& events, std::uint64_t missed)
{
    if (missed != 0)
        out += ": missed " + std::to_string(missed) + " events\n\n";
    for (Event const& e : events) {
        out += "id: ";
        out += std::to_string(e.id);
        out += "\nevent: alert\ndata: ";
        out += *e.data;
        out += "\n\n";
    }
}

EventRing::EventRing(std::size_t capacity)
    : capacity_(capacity == 0 ? 1 : capacity), wake_(eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC))
{
}

EventRing::~EventRing()
{
    if (wake_ >= 0)
        ::close(wake_);
}

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
    signalEventFd(wake_);
    return id;
}

bool EventRing::readAfter(std::uint64_t after, std::chrono::milliseconds wait,
                          std::vector<Event>& out, std::uint64_t* missed)
{
    std::unique_lock<std::mutex> g(lock_);
    arrived_.wait_for(g, wait, [&] { return closed_ || lastId_ > after; });
    return collectLocked(after, out, missed);
}

bool EventRing::collect(std::uint64_t after, std::vector<Event>& out, std::uint64_t* missed) const
{
    std::lock_guard<std::mutex> g(lock_);
    return collectLocked(after, out, missed);
}

bool EventRing::collectLocked(std::uint64_t after, std::vector<Event>& out,
                              std::uint64_t* missed) const
{
    out.clear();
    *missed = 0;
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
    signalEventFd(wake_);
}

std::uint64_t EventRing::lastId() const
{
    std::lock_guard<std::mutex> g(lock_);
    return lastId_;
}

bool EventRing::closed() const
{
    std::lock_guard<std::mutex> g(lock_);
    return closed_;
}

} // namespace icd
