#include "core/AsioDispatcher.h"

#include <pthread.h>

#include <algorithm>
#include <asio.hpp>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

#include "core/Log.h"

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

// The pool for blocking work. A thread starts only when a task finds no idle one (up to a
// limit), and a thread left idle for a while ends: most of the daemon's life needs none, and
// idle threads cost memory. Delayed tasks wait on a timer of `timers` and are then queued here.
class ElasticPoolRunner : public TaskRunner,
                          public std::enable_shared_from_this<ElasticPoolRunner> {
  public:
    ElasticPoolRunner(unsigned maxThreads, asio::thread_pool::executor_type timers)
        : max_(std::max(1u, maxThreads)), timers_(std::move(timers)) {}

    void post(Task task) override {
        std::lock_guard lock(mutex_);
        if (stopped_) {
            return;
        }
        queue_.push_back(std::move(task));
        if (idle_ >= queue_.size()) {
            wake_.notify_one();
        } else if (running_ < max_) {
            try {
                std::thread([self = shared_from_this()] { self->work(); }).detach();
                ++running_;
            } catch (const std::system_error& e) {
                // Out of threads: the task waits for one that runs already, if any.
                qaxLog().error("Cannot start a thread for blocking work: %@",
                               std::string(e.what()));
            }
        }
    }

    void postDelayed(Task task, double seconds) override {
        if (seconds <= 0) {
            return post(std::move(task));
        }
        postDelayedOn(
            timers_,
            [weak = weak_from_this(), task = std::move(task)]() mutable {
                if (auto self = weak.lock()) {
                    self->post(std::move(task));
                }
            },
            seconds);
    }

    // Drops what has not started and waits for the tasks that run.
    void shutdown() {
        std::unique_lock lock(mutex_);
        stopped_ = true;
        queue_.clear();
        wake_.notify_all();
        ended_.wait(lock, [this] { return running_ == 0; });
    }

  private:
    void work() {
        pthread_setname_np(pthread_self(), "qax-blocking");
        std::unique_lock lock(mutex_);
        for (;;) {
            if (!stopped_ && queue_.empty()) {
                ++idle_;
                const bool woken = wake_.wait_for(lock, kIdleLifetime,
                                                  [this] { return stopped_ || !queue_.empty(); });
                --idle_;
                if (!woken) {
                    break;
                }
            }
            if (stopped_) {
                break;
            }
            Task task = std::move(queue_.front());
            queue_.pop_front();
            lock.unlock();
            task();
            task = nullptr;
            lock.lock();
        }
        --running_;
        ended_.notify_all();
    }

    static constexpr std::chrono::seconds kIdleLifetime{10};
    const unsigned max_;
    asio::thread_pool::executor_type timers_;
    std::mutex mutex_;
    std::condition_variable wake_, ended_;
    std::deque<Task> queue_;
    unsigned running_ = 0, idle_ = 0;
    bool stopped_ = false;
};

// The I/O context run by this thread, if it is an I/O thread.
thread_local asio::io_context* currentIoContext = nullptr;

// A serial queue whose tasks run where the work that queues them runs: posted from an I/O
// thread, they run on that thread's loop after the current handler (a request's follow-on
// work then wakes no other thread); posted from anywhere else, on the background pool. Tasks
// run one at a time, in order. Work queued here must not block.
class FollowingSerialQueue : public TaskRunner,
                             public std::enable_shared_from_this<FollowingSerialQueue> {
  public:
    explicit FollowingSerialQueue(asio::thread_pool::executor_type pool) : pool_(std::move(pool)) {}

    void post(Task task) override {
        {
            std::lock_guard lock(mutex_);
            tasks_.push_back(std::move(task));
            if (scheduled_) {
                return;
            }
            scheduled_ = true;
        }
        schedule();
    }

    void postDelayed(Task task, double seconds) override {
        if (seconds <= 0) {
            return post(std::move(task));
        }
        postDelayedOn(
            pool_,
            [self = shared_from_this(), task = std::move(task)]() mutable {
                self->post(std::move(task));
            },
            seconds);
    }

  private:
    void schedule() {
        auto run = [self = shared_from_this()] { self->runSome(); };
        if (currentIoContext && !currentIoContext->stopped()) {
            asio::post(*currentIoContext, std::move(run));
        } else {
            asio::post(pool_, std::move(run));
        }
    }

    // Runs what is queued, a bounded number at a time so that one busy queue does not hold a
    // thread other work waits for.
    void runSome() {
        for (int i = 0; i < kTasksPerTurn; ++i) {
            Task task;
            {
                std::lock_guard lock(mutex_);
                if (tasks_.empty()) {
                    scheduled_ = false;
                    return;
                }
                task = std::move(tasks_.front());
                tasks_.pop_front();
            }
            task();
        }
        schedule();
    }

    static constexpr int kTasksPerTurn = 16;
    asio::thread_pool::executor_type pool_;
    std::mutex mutex_;
    std::deque<Task> tasks_;
    bool scheduled_ = false;
};

// One thread running one io_context. The context is made for a single thread, so its loop
// never hands a ready socket to another thread: the thread that waited for the socket runs the
// handler.
struct IoThread {
    IoThread() : io(1), work(asio::make_work_guard(io)) {
        thread = std::thread([this] {
            pthread_setname_np(pthread_self(), "qax-ipc");
            currentIoContext = &io;
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
          blockingRunner(std::make_shared<ElasticPoolRunner>(blocking, pool.get_executor())) {}
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
    std::shared_ptr<ElasticPoolRunner> blockingRunner;
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
    return std::make_shared<FollowingSerialQueue>(state_->pool.get_executor());
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
