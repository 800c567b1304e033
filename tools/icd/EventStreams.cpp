#include "EventStreams.h"

#include "Log.h"

#include <dirent.h>
#include <fcntl.h>
#include <netdb.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>

namespace icd {
namespace {

using Clock = std::chrono::steady_clock;

// Marks the control eventfd's and the ring's epoll entries apart from the
// subscribers' (whose data is their Subscriber*).
char controlTag;
char ringTag;

// An HTTP/1.1 chunk around `body`.
void frameChunk(std::string& out, std::string const& body)
{
    char head[24];
    int const n = std::snprintf(head, sizeof head, "%zx\r\n", body.size());
    out.assign(head, static_cast<std::size_t>(n));
    out += body;
    out += "\r\n";
}

bool sameEnd(sockaddr_storage const& addr, socklen_t len, std::string const& host, int port)
{
    char h[NI_MAXHOST], p[NI_MAXSERV];
    if (getnameinfo(reinterpret_cast<sockaddr const*>(&addr), len, h, sizeof h, p, sizeof p,
                    NI_NUMERICHOST | NI_NUMERICSERV) != 0)
        return false;
    return host == h && std::atoi(p) == port;
}

} // namespace

int connectionSocket(std::string const& localAddr, int localPort, std::string const& remoteAddr,
                     int remotePort)
{
    DIR* dir = opendir("/proc/self/fd");
    if (!dir)
        return -1;
    int found = -1;
    int const listing = dirfd(dir);
    while (dirent* e = readdir(dir)) {
        char* end = nullptr;
        long const fd = std::strtol(e->d_name, &end, 10);
        if (*end != '\0' || end == e->d_name || fd == listing)
            continue;
        // Only sockets, told by their link text: no call on anyone else's descriptor.
        char link[32];
        ssize_t const n = readlinkat(listing, e->d_name, link, sizeof link);
        if (n < 8 || std::memcmp(link, "socket:[", 8) != 0)
            continue;
        sockaddr_storage peer{}, self{};
        socklen_t peerLen = sizeof peer, selfLen = sizeof self;
        if (getpeername(static_cast<int>(fd), reinterpret_cast<sockaddr*>(&peer), &peerLen) == 0 &&
            getsockname(static_cast<int>(fd), reinterpret_cast<sockaddr*>(&self), &selfLen) == 0 &&
            sameEnd(peer, peerLen, remoteAddr, remotePort) &&
            sameEnd(self, selfLen, localAddr, localPort)) {
            found = static_cast<int>(fd);
            break;
        }
    }
    closedir(dir);
    return found;
}

EventStreams::EventStreams(EventRing& ring, std::chrono::milliseconds keepAlive,
                           std::chrono::milliseconds stallLimit)
    : ring_(ring), keepAlive_(keepAlive), stallLimit_(stallLimit),
      epoll_(epoll_create1(EPOLL_CLOEXEC)), control_(eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC))
{
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.ptr = &controlTag;
    bool ok = epoll_ >= 0 && control_ >= 0 && epoll_ctl(epoll_, EPOLL_CTL_ADD, control_, &ev) == 0;
    ev.data.ptr = &ringTag;
    ok = ok && ring_.wakeFd() >= 0 && epoll_ctl(epoll_, EPOLL_CTL_ADD, ring_.wakeFd(), &ev) == 0;
    if (!ok)
        return; // not running(): streams keep a thread each
    writer_ = std::thread([this] { run(); });
    running_ = true;
}

EventStreams::~EventStreams()
{
    stop();
    if (control_ >= 0)
        ::close(control_);
    if (epoll_ >= 0)
        ::close(epoll_);
}

void EventStreams::stop()
{
    {
        std::lock_guard<std::mutex> g(lock_);
        stopping_ = true;
    }
    signalEventFd(control_);
    if (writer_.joinable())
        writer_.join();
}

EventStreams::Outcome EventStreams::serve(int fd, std::uint64_t after)
{
    // A descriptor of our own for the same connection: the writer then
    // never touches a number that httplib may close and the system reuse.
    int const own = fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (own < 0) {
        ICD_LOG(6000, "event stream: cannot take the connection (errno ", errno, ")");
        return Outcome::Gone;
    }
    auto s = std::make_unique<Subscriber>();
    s->fd = own;
    s->next = after;
    std::future<Outcome> done = s->done.get_future();
    {
        std::lock_guard<std::mutex> g(lock_);
        if (stopping_) {
            ::close(own);
            return Outcome::Closed;
        }
        incoming_.push_back(std::move(s));
    }
    signalEventFd(control_);
    return done.get();
}

void EventStreams::watch(Subscriber& s, bool writable)
{
    epoll_event ev{};
    ev.events = EPOLLRDHUP | (writable ? EPOLLOUT : 0u);
    ev.data.ptr = &s;
    epoll_ctl(epoll_, EPOLL_CTL_MOD, s.fd, &ev);
    s.waitingWritable = writable;
}

void EventStreams::adopt(Clock::time_point now)
{
    std::vector<std::unique_ptr<Subscriber>> arrived;
    {
        std::lock_guard<std::mutex> g(lock_);
        arrived.swap(incoming_);
    }
    for (auto& s : arrived) {
        epoll_event ev{};
        ev.events = EPOLLRDHUP;
        ev.data.ptr = s.get();
        if (epoll_ctl(epoll_, EPOLL_CTL_ADD, s->fd, &ev) != 0) {
            ICD_LOG(6000, "event stream: cannot watch a subscriber's socket (errno ", errno, ")");
            ::close(s->fd);
            s->done.set_value(Outcome::Gone);
            continue;
        }
        s->lastQueued = now;
        active_.push_back(std::move(s));
    }
}

// Gives every subscriber with nothing in flight what it lacks; one text per
// starting point, since most subscribers are at the same one.
void EventStreams::refill(Clock::time_point now)
{
    std::map<std::uint64_t, std::pair<std::string, std::uint64_t>> texts; // after -> chunk, last id
    std::vector<Event> events;
    for (auto it = active_.begin(); it != active_.end();) {
        Subscriber& s = **it++;
        if (!s.out.empty())
            continue;
        auto found = texts.find(s.next);
        if (found == texts.end()) {
            std::uint64_t missed = 0;
            ring_.collect(s.next, events, &missed);
            std::string body;
            appendEventText(body, events, missed);
            std::uint64_t const last = events.empty() ? s.next + missed : events.back().id;
            std::string chunk;
            if (!body.empty())
                frameChunk(chunk, body);
            found = texts.emplace(s.next, std::make_pair(std::move(chunk), last)).first;
        }
        if (!found->second.first.empty()) {
            s.out = found->second.first;
            s.next = found->second.second;
        } else if (now - s.lastQueued >= keepAlive_) {
            frameChunk(s.out, ": keep-alive\n\n");
        } else {
            continue;
        }
        s.lastQueued = now;
        flush(s, now);
    }
}

void EventStreams::flush(Subscriber& s, Clock::time_point now)
{
    while (s.sent < s.out.size()) {
        ssize_t const n = ::send(s.fd, s.out.data() + s.sent, s.out.size() - s.sent,
                                 MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n > 0) {
            s.sent += static_cast<std::size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            if (!s.waitingWritable) {
                s.stalledSince = now;
                watch(s, true);
            }
            return;
        }
        s.failed = true; // the writer drops it on its next pass
        return;
    }
    s.out.clear();
    s.sent = 0;
    if (s.waitingWritable)
        watch(s, false);
}

void EventStreams::finish(std::list<std::unique_ptr<Subscriber>>::iterator it, Outcome outcome)
{
    // Removed by hand: closing a duplicate leaves the connection in the set
    // while httplib's descriptor still holds it.
    epoll_ctl(epoll_, EPOLL_CTL_DEL, (*it)->fd, nullptr);
    ::close((*it)->fd);
    // A chunk cut short leaves the framing broken: only a whole stream can end cleanly.
    if (outcome == Outcome::Closed && !(*it)->out.empty())
        outcome = Outcome::Gone;
    (*it)->done.set_value(outcome);
    active_.erase(it);
}

void EventStreams::run()
{
    std::vector<epoll_event> ready(64);
    for (;;) {
        int const timeout = static_cast<int>(std::min<long long>(keepAlive_.count(), 250));
        int const n = epoll_wait(epoll_, ready.data(), static_cast<int>(ready.size()), timeout);
        Clock::time_point const now = Clock::now();
        bool stopping;
        {
            std::lock_guard<std::mutex> g(lock_);
            stopping = stopping_;
        }
        for (int i = 0; i < n; ++i) {
            void* const tag = ready[static_cast<std::size_t>(i)].data.ptr;
            if (tag == &controlTag) {
                drainEventFd(control_);
            } else if (tag == &ringTag) {
                drainEventFd(ring_.wakeFd());
            } else {
                auto* s = static_cast<Subscriber*>(tag);
                std::uint32_t const what = ready[static_cast<std::size_t>(i)].events;
                if (what & (EPOLLERR | EPOLLHUP | EPOLLRDHUP))
                    s->failed = true;
                else if (what & EPOLLOUT)
                    flush(*s, now);
            }
        }
        adopt(now);
        bool const closed = ring_.closed();
        for (auto it = active_.begin(); it != active_.end();) {
            auto const current = it++;
            Subscriber& s = **current;
            if (s.failed || (!s.out.empty() && now - s.stalledSince >= stallLimit_))
                finish(current, Outcome::Gone);
            else if (stopping || closed)
                finish(current, Outcome::Closed);
        }
        if (stopping)
            return;
        if (!closed) // once closed, late subscribers only come to be finished above
            refill(now);
    }
}

} // namespace icd
