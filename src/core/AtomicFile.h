// Crash-safe file replacement: the new content is written aside, flushed to disk, renamed
// over the old file and the directory entry flushed, so a reader (or a crash at any point)
// sees the old file or the new one, never a torn one. Stateless; any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include <sys/types.h>

namespace qax {

// Files are private to their owner unless `mode` says otherwise. Creates missing parent
// directories first. False with `error` set on failure; the old
// file is then untouched.
bool writeFileAtomically(const std::string& path, std::string_view data,
                         std::string* error = nullptr, mode_t mode = 0600);

// The whole content of a file, or no value when it cannot be read.
std::optional<std::string> readWholeFile(const std::string& path,
                                         std::size_t maxBytes = 64 * 1024 * 1024);

}  // namespace qax
