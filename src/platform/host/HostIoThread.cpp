#include "platform/host/HostIoThread.h"

#include <pthread.h>

namespace qax {

HostIoThread::~HostIoThread() {
    stop();
}

void HostIoThread::start() {
    std::lock_guard lock(mutex_);
    if (thread_.joinable()) {
        return;
    }
    io_.restart();
    work_.emplace(asio::make_work_guard(io_));
    thread_ = std::thread([this] {
        threadId_ = std::this_thread::get_id();
        pthread_setname_np(pthread_self(), "qax-io");
        io_.run();
    });
}

void HostIoThread::stop() {
    std::lock_guard lock(mutex_);
    if (!thread_.joinable()) {
        return;
    }
    work_.reset();
    io_.stop();
    thread_.join();
    threadId_ = std::thread::id{};
}

}  // namespace qax
