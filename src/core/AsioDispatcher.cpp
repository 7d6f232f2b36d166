#include "core/AsioDispatcher.h"

#include <asio.hpp>
#include <chrono>

namespace qax {
namespace {

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
        auto timer = std::make_shared<asio::steady_timer>(
            ex_, std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                     std::chrono::duration<double>(seconds)));
        timer->async_wait([timer, task = std::move(task)](const asio::error_code& ec) {
            if (!ec) {
                task();
            }
        });
    }

  private:
    Executor ex_;
};

}  // namespace

struct AsioDispatcher::State {
    State(unsigned background, unsigned blocking)
        : work(asio::make_work_guard(io)), pool(background), blockingPool(blocking) {}
    asio::io_context io;
    asio::executor_work_guard<asio::io_context::executor_type> work;
    asio::thread_pool pool;
    asio::thread_pool blockingPool;
};

AsioDispatcher::AsioDispatcher(unsigned backgroundThreads, unsigned blockingThreads)
    : state_(std::make_unique<State>(backgroundThreads, blockingThreads)) {
    main_ =
        std::make_shared<AsioRunner<asio::io_context::executor_type>>(state_->io.get_executor());
    background_ =
        std::make_shared<AsioRunner<asio::thread_pool::executor_type>>(state_->pool.get_executor());
    blocking_ = std::make_shared<AsioRunner<asio::thread_pool::executor_type>>(
        state_->blockingPool.get_executor());
}

AsioDispatcher::~AsioDispatcher() {
    shutdown();
}

std::shared_ptr<TaskRunner> AsioDispatcher::makeSerialQueue(std::string) {
    using Strand = asio::strand<asio::thread_pool::executor_type>;
    return std::make_shared<AsioRunner<Strand>>(asio::make_strand(state_->pool.get_executor()));
}

AsioDispatcher::IoStrand AsioDispatcher::makeIoStrand() {
    using Strand = asio::strand<asio::thread_pool::executor_type>;
    Strand strand = asio::make_strand(state_->pool.get_executor());
    return {asio::any_io_executor(strand), std::make_shared<AsioRunner<Strand>>(strand)};
}

asio::io_context& AsioDispatcher::mainContext() {
    return state_->io;
}

void AsioDispatcher::runMainLoop() {
    state_->io.run();
}

void AsioDispatcher::stopMainLoop() {
    state_->work.reset();
    state_->io.stop();
}

void AsioDispatcher::shutdown() {
    if (!state_) {
        return;
    }
    stopMainLoop();
    state_->pool.stop();
    state_->blockingPool.stop();
    state_->pool.join();
    state_->blockingPool.join();
}

}  // namespace qax
