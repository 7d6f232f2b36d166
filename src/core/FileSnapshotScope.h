// While a FileSnapshotScope lives on a thread, the file-backed stores (the preference domain,
// the platform's property-list files) look at each file's identity once: the work sees every
// file as it was when it first read it and pays one stat() per file, not one per value it
// reads. For bounded work such as serving one request; outside any scope every read looks
// again. Scopes nest (the outermost counts). Per thread, no locks.
#pragma once

#include <cstdint>

namespace qax {

class FileSnapshotScope {
  public:
    FileSnapshotScope();
    ~FileSnapshotScope();
    FileSnapshotScope(const FileSnapshotScope&) = delete;
    FileSnapshotScope& operator=(const FileSnapshotScope&) = delete;

    // The scope live on this thread, unique in the process; 0 outside any scope.
    static std::uint64_t current();
};

}  // namespace qax
