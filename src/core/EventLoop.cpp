#include "core/EventLoop.h"

#include <pthread.h>

#include <exception>
#include <string>

#include "core/Log.h"

namespace kesu {

EventLoop::EventLoop(std::size_t workers) : workers_(workers > 0 ? workers : 1) {}

EventLoop::~EventLoop() { stop(); }

void EventLoop::start() {
    if (thread_.joinable()) return;
    if (io_.stopped()) io_.restart();
    guard_.emplace(io_.get_executor());
    thread_ = std::thread([this] {
        loopThread_.store(std::this_thread::get_id());
        pthread_setname_np(pthread_self(), "kesu-loop");
        for (;;) {
            try {
                io_.run();
                break;
            } catch (const std::exception& e) {
                // One handler's failure must not end the whole service's loop.
                Log::mPrintlog(std::string("[EventLoop] handler failed: ") + e.what());
            }
        }
        loopThread_.store(std::thread::id());
    });
}

void EventLoop::stop() {
    std::shared_ptr<asio::thread_pool> pool;
    {
        std::lock_guard<std::mutex> lock(poolMutex_);
        pool = std::move(pool_);
    }
    if (pool) {
        pool->stop();  // queued work is dropped; work that runs finishes
        pool->join();
    }
    if (thread_.joinable()) {
        guard_.reset();
        io_.stop();
        thread_.join();
    }
}

void EventLoop::nameWorker() {
    thread_local bool named = false;
    if (named) return;
    named = true;
    pthread_setname_np(pthread_self(), "kesu-pool");
}

std::shared_ptr<asio::thread_pool> EventLoop::pool() {
    std::lock_guard<std::mutex> lock(poolMutex_);
    if (!pool_) {
        // A new thread starts with its creator's name: the pool's threads are named from the
        // start, not only once they first run work.
        char creatorName[16] = {};
        pthread_getname_np(pthread_self(), creatorName, sizeof creatorName);
        pthread_setname_np(pthread_self(), "kesu-pool");
        pool_ = std::make_shared<asio::thread_pool>(workers_);
        pthread_setname_np(pthread_self(), creatorName);
    }
    return pool_;
}

}  // namespace kesu
