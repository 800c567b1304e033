// The servers' connection threads: a fixed number of workers and a bounded
// queue. When both are full the accepting thread waits, so further clients
// wait in the kernel's backlog instead of costing memory here.
#pragma once

#include <httplib.h>

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace icd {

class WorkerPool : public httplib::TaskQueue {
public:
    WorkerPool(std::size_t workers, std::size_t queued);
    ~WorkerPool() override;

    void enqueue(std::function<void()> job) override;
    void shutdown() override;

private:
    void work();

    std::size_t const maxQueued_;
    std::mutex lock_;
    std::condition_variable ready_, space_;
    std::deque<std::function<void()>> jobs_;
    bool shutdown_ = false;
    std::vector<std::thread> threads_;
};

} // namespace icd
