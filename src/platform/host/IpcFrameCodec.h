// The framing of the agent's IPC stream: a 4-byte big-endian length N (1 <= N <= 4 MiB), then
// N bytes of a property list (binary or XML; written binary). The decoder takes bytes as they
// arrive and hands out whole frames. Used by the agent's connections and by clients. Not
// thread-safe: one decoder per stream, used by one thread at a time.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "core/Value.h"

namespace qax {

inline constexpr std::size_t kMaxIpcFrameBytes = 4 * 1024 * 1024;
inline constexpr std::size_t kIpcFrameHeaderBytes = 4;

class IpcFrameCodec {
  public:
    enum class Status { NeedMore, Frame, Error };

    void append(std::string_view bytes);
    // The next whole frame's payload into `payload`. Error (with a reason) when the length
    // header is out of range; the stream cannot be resynchronised after that.
    Status next(std::string& payload, std::string* error = nullptr);
    // The same without a copy: `payload` points into the decoder and stays valid until the
    // next call of append() or release().
    Status next(std::string_view& payload, std::string* error = nullptr);
    // Whether bytes of a frame not yet complete are held.
    bool hasPartialFrame() const { return buffered() > 0; }
    std::size_t buffered() const { return buffer_.size() - consumed_; }
    // Gives back the memory of a large frame once nothing is held, so that a connection that
    // once sent a big request does not keep its buffer.
    void release();

    // Header and payload of one frame; none when the payload is empty or over the limit.
    static std::optional<std::string> frame(std::string_view payload);
    // A message as a framed binary property list; none when it cannot be encoded.
    static std::optional<std::string> encode(const Value& message);

  private:
    std::string buffer_;
    std::size_t consumed_ = 0;
};

}  // namespace qax
