// Append-only JSON-lines files of the platform state (analytics.jsonl, notifications.jsonl):
// one compact JSON object per line, each appended with a single write to a file opened for
// appending, so lines of concurrent writers (threads or processes) never interleave.
// Stateless; any thread.
#pragma once

#include <string>

#include "core/Value.h"

namespace qax {

class JsonLinesFile {
  public:
    // Creates the file and its directory when missing. False with `error` on failure.
    static bool append(const std::string& path, const Value& record, std::string* error);
};

}  // namespace qax
