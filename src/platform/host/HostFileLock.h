// An exclusive advisory lock (flock) on a side file, held for the object's lifetime, so that
// processes sharing a state file (the agent and qaxctl) never interleave a read-modify-write.
// The lock file is never replaced, unlike the file it guards. One object per critical section;
// any thread (flock locks of separate opens also exclude each other within one process).
#pragma once

#include <string>

namespace qax {

class HostFileLock {
  public:
    // Creates the lock file (and its directory) when missing and waits for the lock.
    explicit HostFileLock(const std::string& lockPath);
    ~HostFileLock();
    HostFileLock(const HostFileLock&) = delete;
    HostFileLock& operator=(const HostFileLock&) = delete;

    // False when the lock file could not be opened or locked: the caller goes on unguarded.
    bool locked() const { return locked_; }

  private:
    int fd_ = -1;
    bool locked_ = false;
};

}  // namespace qax
