// Waits for an asynchronous operation whose completion may run on any thread.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <memory>

namespace qax::test {

// Calls `start(done)` and returns what the operation hands to `done`; a test failure and T{}
// when `seconds` pass first.
template <typename T, typename Start>
T await(Start start, double seconds = 20) {
    auto promise = std::make_shared<std::promise<T>>();
    auto future = promise->get_future();
    start([promise](T value) { promise->set_value(std::move(value)); });
    if (future.wait_for(std::chrono::duration<double>(seconds)) != std::future_status::ready) {
        ADD_FAILURE() << "the completion was not called";
        return T{};
    }
    return future.get();
}

}  // namespace qax::test
