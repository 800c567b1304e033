#include "WorkerPool.h"

namespace icd {

WorkerPool::WorkerPool(std::size_t workers, std::size_t queued) : maxQueued_(queued)
{
    for (std::size_t i = 0; i < (workers == 0 ? 1 : workers); ++i)
        threads_.emplace_back([this] { work(); });
}

WorkerPool::~WorkerPool()
{
    shutdown();
}

void WorkerPool::enqueue(std::function<void()> job)
{
    {
        std::unique_lock<std::mutex> g(lock_);
        space_.wait(g, [this] { return shutdown_ || jobs_.size() < maxQueued_; });
        jobs_.push_back(std::move(job)); // even when shutting down: it closes its socket
    }
    ready_.notify_one();
}

void WorkerPool::shutdown()
{
    {
        std::lock_guard<std::mutex> g(lock_);
        if (shutdown_ && threads_.empty())
            return;
        shutdown_ = true;
    }
    ready_.notify_all();
    space_.notify_all();
    for (std::thread& t : threads_)
        t.join();
    threads_.clear();
}

void WorkerPool::work()
{
    for (;;) {
        std::function<void()> job;
        {
            std::unique_lock<std::mutex> g(lock_);
            ready_.wait(g, [this] { return shutdown_ || !jobs_.empty(); });
            if (jobs_.empty())
                return;
            job = std::move(jobs_.front());
            jobs_.pop_front();
        }
        space_.notify_one();
        job();
    }
}

} // namespace icd
