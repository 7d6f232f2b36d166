#include "platform/host/HostProcessLifecycle.h"

#include <cstdlib>
#include <string>

#include "core/Log.h"

namespace qax {
namespace {

constexpr const char* kIdleExitVariable = "QAX_IDLE_EXIT_SECONDS";

}  // namespace

HostProcessLifecycle::HostProcessLifecycle(bool startedOnDemand, double idleExitSeconds,
                                           std::shared_ptr<TaskRunner> mainQueue,
                                           std::function<void()> exitMainLoop)
    : startedOnDemand_(startedOnDemand && mainQueue),
      idleExitSeconds_(idleExitSeconds),
      mainQueue_(std::move(mainQueue)),
      exitMainLoop_(std::move(exitMainLoop)) {}

double HostProcessLifecycle::idleExitSecondsFromEnvironment() {
    const char* text = std::getenv(kIdleExitVariable);
    if (!text || !*text) {
        return kDefaultIdleExitSeconds;
    }
    char* end = nullptr;
    const double seconds = std::strtod(text, &end);
    if (*end != '\0' || !(seconds > 0)) {
        qaxLog().error("Ignoring %s=%@: not a positive number of seconds", kIdleExitVariable, text);
        return kDefaultIdleExitSeconds;
    }
    return seconds;
}

void HostProcessLifecycle::start() {
    if (!startedOnDemand_) {
        return;
    }
    std::uint64_t generation;
    {
        std::lock_guard lock(mutex_);
        if (open_ > 0) {
            return;  // the last transaction to end arms the idle check
        }
        generation = ++generation_;
    }
    mainQueue_->postDelayed(
        [weak = weak_from_this(), generation] {
            if (auto self = weak.lock()) {
                self->tryExit(generation);
            }
        },
        idleExitSeconds_);
}

void HostProcessLifecycle::setAcceptGate(std::function<void(bool)> gate) {
    std::lock_guard lock(mutex_);
    acceptGate_ = std::move(gate);
}

int HostProcessLifecycle::openTransactions() const {
    std::lock_guard lock(mutex_);
    return open_;
}

void HostProcessLifecycle::requestCleanExit() {
    if (!startedOnDemand_) {
        qaxLog().info(
            "Clean exit requested, but the agent was not started on demand: it keeps running");
        return;
    }
    std::uint64_t generation;
    {
        std::lock_guard lock(mutex_);
        cleanExitRequested_ = true;
        if (open_ > 0) {
            qaxLog().info("Clean exit requested: exiting once %d open transactions end", open_);
            return;
        }
        generation = generation_;
    }
    mainQueue_->post([weak = weak_from_this(), generation] {
        if (auto self = weak.lock()) {
            self->tryExit(generation);
        }
    });
}

std::shared_ptr<void> HostProcessLifecycle::beginTransaction(std::string_view reason) {
    int open;
    {
        std::lock_guard lock(mutex_);
        open = ++open_;
        ++generation_;
    }
    qaxLog().debug("Transaction began: %@ (%d open)", reason, open);
    return std::shared_ptr<void>(new std::string(reason), [weak = weak_from_this()](void* token) {
        auto* name = static_cast<std::string*>(token);
        if (auto self = weak.lock()) {
            qaxLog().debug("Transaction ended: %@", *name);
            self->endTransaction();
        }
        delete name;
    });
}

void HostProcessLifecycle::endTransaction() {
    std::uint64_t generation;
    bool now;
    {
        std::lock_guard lock(mutex_);
        --open_;
        generation = ++generation_;
        if (open_ > 0 || !startedOnDemand_ || exited_) {
            return;
        }
        now = cleanExitRequested_;
    }
    auto check = [weak = weak_from_this(), generation] {
        if (auto self = weak.lock()) {
            self->tryExit(generation);
        }
    };
    if (now) {
        mainQueue_->post(std::move(check));
    } else {
        mainQueue_->postDelayed(std::move(check), idleExitSeconds_);
    }
}

void HostProcessLifecycle::tryExit(std::uint64_t generation) {
    std::function<void(bool)> gate;
    {
        std::lock_guard lock(mutex_);
        if (exited_ || open_ > 0 || generation != generation_) {
            return;
        }
        gate = acceptGate_;
    }
    // A client the listener has already taken off the socket is handled before the look
    // below, which is queued behind it.
    if (gate) {
        gate(false);
    }
    mainQueue_->post([weak = weak_from_this(), generation] {
        if (auto self = weak.lock()) {
            self->finishExit(generation);
        }
    });
}

void HostProcessLifecycle::finishExit(std::uint64_t generation) {
    std::function<void(bool)> gate;
    bool exiting = false;
    bool cleanExit;
    {
        std::lock_guard lock(mutex_);
        if (exited_) {
            return;
        }
        if (open_ == 0 && generation == generation_) {
            exited_ = exiting = true;
        }
        gate = acceptGate_;
        cleanExit = cleanExitRequested_;
    }
    if (!exiting) {
        // Something began meanwhile: serve on. Its end arms the next check.
        if (gate) {
            gate(true);
        }
        return;
    }
    if (cleanExit) {
        qaxLog().info("Exiting on request: no client, activity run or download is left");
    } else {
        qaxLog().info("Exiting after %@ seconds without a client, activity run or download",
                      idleExitSeconds_);
    }
    exitMainLoop_();
}

}  // namespace qax
