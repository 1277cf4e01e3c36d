#include "control/OnDemandTaskQueue.h"

#include <pthread.h>

#include <utility>

namespace kesu {

OnDemandTaskQueue::OnDemandTaskQueue(std::size_t maxWorkers, std::chrono::milliseconds idleTimeout, std::size_t keep)
    : maxWorkers_(maxWorkers == 0 ? 1 : maxWorkers), idleTimeout_(idleTimeout), keep_(keep) {}

OnDemandTaskQueue::~OnDemandTaskQueue() { shutdown(); }

void OnDemandTaskQueue::enqueue(std::function<void()> fn) {
    std::vector<std::thread> ended;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        ended.swap(ended_);
        if (!shutdown_) {
            jobs_.push_back(std::move(fn));
            // Every idle worker takes one job; a job beyond them gets a new worker.
            if (jobs_.size() > idle_ && alive_ < maxWorkers_) {
                ++alive_;
                auto self = threads_.emplace(threads_.end());
                *self = std::thread([this, self] { work(self); });
                workersChanged_.notify_all();
            }
            jobReady_.notify_one();
            fn = nullptr;
        }
    }
    if (fn) fn();  // after the shutdown: run here, the task owns its connection
    for (auto& t : ended) t.join();
}

void OnDemandTaskQueue::work(std::list<std::thread>::iterator self) {
    pthread_setname_np(pthread_self(), "kesu-http");
    std::vector<std::thread> ended;
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
        ++idle_;
        const auto ready = [this] { return shutdown_ || !jobs_.empty(); };
        // A worker that would stay anyway waits without waking up.
        bool woken = true;
        if (alive_ > keep_) woken = jobReady_.wait_for(lock, idleTimeout_, ready);
        else jobReady_.wait(lock, ready);
        --idle_;
        if (!jobs_.empty()) {
            std::function<void()> fn = std::move(jobs_.front());
            jobs_.pop_front();
            lock.unlock();
            fn();
            fn = nullptr;
            lock.lock();
            continue;
        }
        if (shutdown_ || (!woken && alive_ > keep_)) break;
    }
    --alive_;
    // Join the workers that ended before this one; this one is joined by the next.
    ended.swap(ended_);
    ended_.push_back(std::move(*self));
    threads_.erase(self);
    workersChanged_.notify_all();
    lock.unlock();
    for (auto& t : ended) t.join();
}

void OnDemandTaskQueue::shutdown() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        shutdown_ = true;
    }
    jobReady_.notify_all();
    {
        std::unique_lock<std::mutex> lock(mutex_);
        // Like the library's own pool: a handler under way is waited for.
        workersChanged_.wait(lock, [this] { return alive_ == 0; });
    }
    std::vector<std::thread> ended;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        ended.swap(ended_);
    }
    for (auto& t : ended)
        if (t.joinable()) t.join();
}

std::size_t OnDemandTaskQueue::workers() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return alive_;
}

bool OnDemandTaskQueue::waitForWorkers(std::size_t count, std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return workersChanged_.wait_for(lock, timeout, [&] { return alive_ == count; });
}

}  // namespace kesu
