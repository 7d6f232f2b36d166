#include "core/FileSnapshotScope.h"

#include <atomic>

namespace qax {
namespace {

struct ThreadScope {
    int depth = 0;
    std::uint64_t id = 0;
};

ThreadScope& threadScope() {
    thread_local ThreadScope scope;
    return scope;
}

std::atomic<std::uint64_t> nextScope{1};

}  // namespace

FileSnapshotScope::FileSnapshotScope() {
    ThreadScope& scope = threadScope();
    if (scope.depth++ == 0) {
        scope.id = nextScope.fetch_add(1, std::memory_order_relaxed);
    }
}

FileSnapshotScope::~FileSnapshotScope() {
    ThreadScope& scope = threadScope();
    if (--scope.depth == 0) {
        scope.id = 0;
    }
}

std::uint64_t FileSnapshotScope::current() {
    return threadScope().id;
}

}  // namespace qax
