// Writes a Value as a binary property list ("bplist00") for the IPC stream, in one buffer and
// one pass over the tree. The general codec goes through libplist's writer, which sets up and
// tears down a large hash table for every document: most of the cost of a small reply. This
// writer does not share equal objects, which readers do not need, and otherwise encodes what
// the general codec encodes, failing where it fails (a null anywhere, a date outside its
// range); a string ends at its first NUL there, and here. Stateless; any thread.
#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

class BinaryPlistWriter {
  public:
    // The document, after `headroom` zero bytes the caller may fill (a frame header); none
    // when the value has no property-list form.
    static std::optional<std::string> write(const Value& value, std::size_t headroom = 0);
};

}  // namespace qax
