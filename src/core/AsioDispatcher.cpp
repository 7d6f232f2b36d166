#include "core/AsioDispatcher.h"

#include <pthread.h>

#include <algorithm>
#include <asio.hpp>
#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>
#include <vector>

namespace qax {
namespace {

template <typename Executor>
void postDelayedOn(const Executor& ex, Task task, double seconds) {
    auto timer = std::make_shared<asio::steady_timer>(
        ex, std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                std::chrono::duration<double>(seconds)));
    timer->async_wait([timer, task = std::move(task)](const asio::error_code& ec) {
        if (!ec) {
            task();
        }
    });
}

template <typename Executor>
class AsioRunner : public TaskRunner {
  public:
    explicit AsioRunner(Executor ex) : ex_(std::move(ex)) {}

    void post(Task task) override { asio::post(ex_, std::move(task)); }

    void postDelayed(Task task, double seconds) override {
        if (seconds <= 0) {
            post(std::move(task));
            return;
        }
        postDelayedOn(ex_, std::move(task), seconds);
    }

  private:
    Executor ex_;
};

// A thread pool whose threads start with the first task: most runs of the daemon never do
// blocking work, and idle threads cost memory.
class LazyPoolRunner : public TaskRunner {
  public:
    explicit LazyPoolRunner(unsigned threads) : threads_(std::max(1u, threads)) {}

    void post(Task task) override {
        if (auto* pool = started()) {
            asio::post(*pool, std::move(task));
        }
    }

    void postDelayed(Task task, double seconds) override {
        if (seconds <= 0) {
            post(std::move(task));
        } else if (auto* pool = started()) {
            postDelayedOn(pool->get_executor(), std::move(task), seconds);
        }
    }

    void shutdown() {
        std::unique_ptr<asio::thread_pool> pool;
        {
            std::lock_guard lock(mutex_);
            stopped_ = true;
            pool = std::move(pool_);
        }
        if (pool) {
            pool->stop();
            pool->join();
        }
    }

  private:
    // The pool, started now if need be; none once shut down (the task is dropped, as a
    // stopped pool would drop it).
    asio::thread_pool* started() {
        std::lock_guard lock(mutex_);
        if (!pool_ && !stopped_) {
            pool_ = std::make_unique<asio::thread_pool>(threads_);
        }
        return pool_.get();
    }

    const unsigned threads_;
    std::mutex mutex_;
    std::unique_ptr<asio::thread_pool> pool_;
    bool stopped_ = false;
};

// One thread running one io_context. The context is made for a single thread, so its loop
// never hands a ready socket to another thread: the thread that waited for the socket runs the
// handler.
struct IoThread {
    IoThread() : io(1), work(asio::make_work_guard(io)) {
        thread = std::thread([this] {
            pthread_setname_np(pthread_self(), "qax-ipc");
            io.run();
        });
    }
    void stop() {
        work.reset();
        io.stop();
        if (thread.joinable()) {
            thread.join();
        }
    }
    asio::io_context io;
    asio::executor_work_guard<asio::io_context::executor_type> work;
    std::thread thread;
};

}  // namespace

struct AsioDispatcher::State {
    State(unsigned background, unsigned blocking, unsigned io)
        : work(asio::make_work_guard(main)),
          ioThreadCount(io),
          pool(background),
          blockingRunner(std::make_shared<LazyPoolRunner>(blocking)) {}
    asio::io_context main;
    asio::executor_work_guard<asio::io_context::executor_type> work;

    // Declared before the pools, so destroyed after them: a task dropped there may hold the
    // last reference to a socket of an I/O context.
    const unsigned ioThreadCount;
    std::mutex ioMutex;
    bool ioStopped = false;
    std::vector<std::unique_ptr<IoThread>> ioThreads;
    std::atomic<unsigned> nextIoThread{0};

    asio::thread_pool pool;
    std::shared_ptr<LazyPoolRunner> blockingRunner;
};

unsigned AsioDispatcher::hardwareThreads() {
    return std::max(1u, std::thread::hardware_concurrency());
}

AsioDispatcher::AsioDispatcher(unsigned backgroundThreads, unsigned blockingThreads)
    : state_(std::make_unique<State>(backgroundThreads ? backgroundThreads : hardwareThreads(),
                                     blockingThreads, hardwareThreads())) {
    main_ =
        std::make_shared<AsioRunner<asio::io_context::executor_type>>(state_->main.get_executor());
    background_ =
        std::make_shared<AsioRunner<asio::thread_pool::executor_type>>(state_->pool.get_executor());
    blocking_ = state_->blockingRunner;
}

AsioDispatcher::~AsioDispatcher() {
    shutdown();
}

std::shared_ptr<TaskRunner> AsioDispatcher::makeSerialQueue(std::string) {
    using Strand = asio::strand<asio::thread_pool::executor_type>;
    return std::make_shared<AsioRunner<Strand>>(asio::make_strand(state_->pool.get_executor()));
}

AsioDispatcher::IoStrand AsioDispatcher::makeIoStrand() {
    asio::io_context* io = nullptr;
    {
        std::lock_guard lock(state_->ioMutex);
        if (state_->ioThreads.empty() && !state_->ioStopped) {
            for (unsigned i = 0; i < state_->ioThreadCount; ++i) {
                state_->ioThreads.push_back(std::make_unique<IoThread>());
            }
        }
        if (!state_->ioThreads.empty()) {
            const unsigned n = state_->nextIoThread++ % state_->ioThreads.size();
            io = &state_->ioThreads[n]->io;
        }
    }
    // After shutdown nothing runs anyway; the pool's (stopped) executor keeps the caller
    // working without a thread.
    using PoolStrand = asio::strand<asio::thread_pool::executor_type>;
    if (!io) {
        PoolStrand strand = asio::make_strand(state_->pool.get_executor());
        return {asio::any_io_executor(strand), std::make_shared<AsioRunner<PoolStrand>>(strand)};
    }
    using Strand = asio::strand<asio::io_context::executor_type>;
    Strand strand = asio::make_strand(io->get_executor());
    return {asio::any_io_executor(strand), std::make_shared<AsioRunner<Strand>>(strand)};
}

asio::io_context& AsioDispatcher::mainContext() {
    return state_->main;
}

void AsioDispatcher::runMainLoop() {
    state_->main.run();
}

void AsioDispatcher::stopMainLoop() {
    state_->work.reset();
    state_->main.stop();
}

void AsioDispatcher::shutdown() {
    if (!state_) {
        return;
    }
    stopMainLoop();
    std::vector<IoThread*> ioThreads;
    {
        std::lock_guard lock(state_->ioMutex);
        state_->ioStopped = true;
        for (auto& t : state_->ioThreads) {
            ioThreads.push_back(t.get());
        }
    }
    // The contexts themselves stay until the dispatcher goes: sockets bound to them may still
    // be held.
    for (auto* t : ioThreads) {
        t->stop();
    }
    state_->pool.stop();
    state_->blockingRunner->shutdown();
    state_->pool.join();
}

}  // namespace qax
