// The service's one event loop: a single thread runs every socket and every timer of the
// service, and a small bounded pool runs what blocks (HTTP requests, program launches, ping,
// SQLite reads) and posts the result back to the loop.
#pragma once

#include <asio/async_result.hpp>
#include <asio/awaitable.hpp>
#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/post.hpp>
#include <asio/thread_pool.hpp>
#include <asio/use_awaitable.hpp>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <type_traits>
#include <utility>

namespace kesu {

class EventLoop {
public:
    // `workers` threads for blocking work; they are started on first use.
    explicit EventLoop(std::size_t workers = 2);
    ~EventLoop();  // stop()
    EventLoop(const EventLoop&) = delete;
    EventLoop& operator=(const EventLoop&) = delete;

    // Starts the loop thread. A second start while running does nothing.
    void start();
    // Ends the loop: handlers queued or running finish, timers and reads still pending are
    // abandoned (their owners cancel them in their own stop, which comes first), the worker
    // pool takes no new work, finishes what runs and its threads end. Idempotent; must not be
    // called from the loop itself or from a worker.
    void stop();
    bool running() const { return thread_.joinable(); }

    asio::io_context& context() { return io_; }
    asio::io_context::executor_type executor() { return io_.get_executor(); }
    // True on the loop's own thread.
    bool inLoop() const { return std::this_thread::get_id() == loopThread_.load(); }

    // Queues `fn` to run on the loop.
    template <class F>
    void post(F&& fn) {
        asio::post(io_, std::forward<F>(fn));
    }

    // Runs `work` on the worker pool, then `done(result)` (or `done()` for a void `work`) on
    // the loop. `done` is dropped when the loop has ended meanwhile.
    template <class Work, class Done>
    void offload(Work work, Done done) {
        asio::post(*pool(), [this, work = std::move(work), done = std::move(done)]() mutable {
            nameWorker();
            if constexpr (std::is_void_v<std::invoke_result_t<Work&>>) {
                work();
                asio::post(io_, std::move(done));
            } else {
                asio::post(io_, [done = std::move(done), result = work()]() mutable { done(std::move(result)); });
            }
        });
    }
    // The awaitable form of offload for a coroutine on the loop: `co_await loop.runBlocking(fn)`
    // runs `fn` on the worker pool and resumes the coroutine on the loop with its result. When
    // the loop ends meanwhile the coroutine is never resumed (its frame is destroyed).
    // Pass a named function object (std::move(fn)), not a lambda written in the co_await
    // expression: g++ 12 destroys such temporaries of a co_await operand twice.
    template <class Work>
    auto runBlocking(Work&& work) {
        using W = std::decay_t<Work>;
        using R = std::invoke_result_t<W&>;
        auto initiate = [this](auto handler, W work) { offload(std::move(work), std::move(handler)); };
        if constexpr (std::is_void_v<R>) {
            return asio::async_initiate<const asio::use_awaitable_t<>&, void()>(initiate, asio::use_awaitable,
                                                                                W(std::forward<Work>(work)));
        } else {
            return asio::async_initiate<const asio::use_awaitable_t<>&, void(R)>(initiate, asio::use_awaitable,
                                                                                 W(std::forward<Work>(work)));
        }
    }
    // Runs `work` on the worker pool (fire and forget).
    template <class Work>
    void offload(Work work) {
        asio::post(*pool(), [work = std::move(work)]() mutable {
            nameWorker();
            work();
        });
    }

    // Runs `fn` on the loop and waits for its result, at most `timeout`; nullopt (or false
    // for a void `fn`) when it did not run in time. Runs `fn` directly when called on the loop
    // or while the loop is not running. For start and stop paths and tests.
    template <class F>
    auto call(F fn, std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
        using R = std::invoke_result_t<F&>;
        if constexpr (std::is_void_v<R>) {
            if (inLoop() || !running()) {
                fn();
                return true;
            }
            auto done = std::make_shared<std::promise<void>>();
            auto future = done->get_future();
            post([fn = std::move(fn), done]() mutable {
                fn();
                done->set_value();
            });
            return future.wait_for(timeout) == std::future_status::ready;
        } else {
            if (inLoop() || !running()) return std::optional<R>(fn());
            auto done = std::make_shared<std::promise<R>>();
            auto future = done->get_future();
            post([fn = std::move(fn), done]() mutable { done->set_value(fn()); });
            if (future.wait_for(timeout) != std::future_status::ready) return std::optional<R>();
            return std::optional<R>(future.get());
        }
    }

private:
    // Names the calling pool thread "kesu-pool" (once per thread), so that it can be told
    // apart in the process's thread list.
    static void nameWorker();
    // The pool, made on first use; work posted to it after stop() is dropped.
    std::shared_ptr<asio::thread_pool> pool();

    asio::io_context io_;
    std::optional<asio::executor_work_guard<asio::io_context::executor_type>> guard_;
    std::thread thread_;
    std::atomic<std::thread::id> loopThread_{};
    const std::size_t workers_;
    std::mutex poolMutex_;
    std::shared_ptr<asio::thread_pool> pool_;
};

}  // namespace kesu
