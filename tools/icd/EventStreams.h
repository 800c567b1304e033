// The event streams' one writer. Each alert used to wake every subscriber's
// connection thread: a hundred threads fighting over two cores for every
// alert, the plug-in that raises them waiting its turn. Here one thread
// waits on every subscriber's socket at once (epoll), composes what a
// subscriber lacks once for all who lack the same, and sends without
// blocking; a client that does not read only keeps its own bytes waiting.
// Connection threads hand their socket over and sleep until it comes back.
#pragma once

#include "EventRing.h"

#include <chrono>
#include <cstdint>
#include <future>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace icd {

class EventStreams {
public:
    enum class Outcome {
        Closed, // the ring closed: end the stream cleanly
        Gone,   // the client left or stopped reading: drop the connection
    };

    EventStreams(EventRing& ring, std::chrono::milliseconds keepAlive,
                 std::chrono::milliseconds stallLimit);
    ~EventStreams();
    EventStreams(EventStreams const&) = delete;
    EventStreams& operator=(EventStreams const&) = delete;

    // Streams the events after `after` as HTTP chunks on the connected socket
    // fd (its response head already sent) until one of the outcomes. The
    // writer sends on a duplicate of fd, with MSG_DONTWAIT, and closes it.
    Outcome serve(int fd, std::uint64_t after);

    // Ends every stream (Closed) and the writer; serve returns at once after.
    void stop();

    // False when the writer could not start (no epoll or eventfd): serve
    // must not be called then.
    bool running() const { return running_; }

private:
    struct Subscriber {
        int fd;
        std::uint64_t next;                // the last event id queued
        std::string out;                   // a chunk not yet wholly sent
        std::size_t sent = 0;
        bool waitingWritable = false;
        bool failed = false; // the socket failed or the client left
        std::chrono::steady_clock::time_point lastQueued;
        std::chrono::steady_clock::time_point stalledSince;
        std::promise<Outcome> done;
    };

    void run();
    void adopt(std::chrono::steady_clock::time_point now);
    void refill(std::chrono::steady_clock::time_point now);
    void flush(Subscriber& s, std::chrono::steady_clock::time_point now);
    void finish(std::list<std::unique_ptr<Subscriber>>::iterator it, Outcome outcome);
    void watch(Subscriber& s, bool writable);

    EventRing& ring_;
    std::chrono::milliseconds const keepAlive_;
    std::chrono::milliseconds const stallLimit_;
    int epoll_ = -1;
    int control_ = -1; // eventfd: new subscribers or stop
    std::mutex lock_;  // guards incoming_ and stopping_
    std::vector<std::unique_ptr<Subscriber>> incoming_;
    bool stopping_ = false;
    bool running_ = false; // set once, before any stream is served
    std::list<std::unique_ptr<Subscriber>> active_; // the writer's own
    std::thread writer_;
};

// The socket of the connection with these local and remote ends, or -1.
// httplib gives a handler no socket; a TCP connection's two ends name it.
int connectionSocket(std::string const& localAddr, int localPort, std::string const& remoteAddr,
                     int remotePort);

} // namespace icd
