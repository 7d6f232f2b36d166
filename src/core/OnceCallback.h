// Completions are called exactly once. onceCallback() wraps a completion so that a second
// call is caught: it is logged as an error and dropped (and aborts in debug builds).
#pragma once

#include <atomic>
#include <cstdlib>
#include <functional>
#include <memory>

#include "core/Log.h"

namespace qax {

template <typename... Args>
std::function<void(Args...)> onceCallback(std::function<void(Args...)> fn,
                                          const char* name = "completion") {
    struct State {
        std::function<void(Args...)> fn;
        std::atomic<bool> called{false};
    };
    auto state = std::make_shared<State>();
    state->fn = std::move(fn);
    return [state, name](Args... args) {
        if (state->called.exchange(true)) {
            qaxLog().error("%s called more than once", name);
#ifndef NDEBUG
            std::abort();
#endif
            return;
        }
        auto f = std::move(state->fn);
        if (f) {
            f(std::forward<Args>(args)...);
        }
    };
}

}  // namespace qax
