#include "platform/host/IpcFrameCodec.h"

#include <cstdint>

#include "core/PlistCodec.h"

namespace qax {

void IpcFrameCodec::append(std::string_view bytes) {
    // Drop what has been handed out before the buffer grows again.
    if (consumed_ > 0 && consumed_ >= buffer_.size() / 2) {
        buffer_.erase(0, consumed_);
        consumed_ = 0;
    }
    buffer_.append(bytes);
}

IpcFrameCodec::Status IpcFrameCodec::next(std::string& payload, std::string* error) {
    if (buffered() < kIpcFrameHeaderBytes) {
        return Status::NeedMore;
    }
    const auto* p = reinterpret_cast<const unsigned char*>(buffer_.data() + consumed_);
    const std::uint32_t length = (std::uint32_t(p[0]) << 24) | (std::uint32_t(p[1]) << 16) |
                                 (std::uint32_t(p[2]) << 8) | std::uint32_t(p[3]);
    if (length == 0 || length > kMaxIpcFrameBytes) {
        if (error) {
            *error = "frame length " + std::to_string(length) + " is outside 1.." +
                     std::to_string(kMaxIpcFrameBytes);
        }
        return Status::Error;
    }
    if (buffered() < kIpcFrameHeaderBytes + length) {
        return Status::NeedMore;
    }
    payload.assign(buffer_, consumed_ + kIpcFrameHeaderBytes, length);
    consumed_ += kIpcFrameHeaderBytes + length;
    if (consumed_ == buffer_.size()) {
        buffer_.clear();
        consumed_ = 0;
    }
    return Status::Frame;
}

std::optional<std::string> IpcFrameCodec::frame(std::string_view payload) {
    if (payload.empty() || payload.size() > kMaxIpcFrameBytes) {
        return std::nullopt;
    }
    const auto n = static_cast<std::uint32_t>(payload.size());
    std::string out;
    out.reserve(kIpcFrameHeaderBytes + payload.size());
    out.push_back(static_cast<char>((n >> 24) & 0xff));
    out.push_back(static_cast<char>((n >> 16) & 0xff));
    out.push_back(static_cast<char>((n >> 8) & 0xff));
    out.push_back(static_cast<char>(n & 0xff));
    out.append(payload);
    return out;
}

std::optional<std::string> IpcFrameCodec::encode(const Value& message) {
    auto bytes = toBinaryPlist(message);
    if (!bytes) {
        return std::nullopt;
    }
    return frame(*bytes);
}

}  // namespace qax
