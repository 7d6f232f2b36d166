#include "platform/host/IpcFrameCodec.h"

#include <cstdint>

#include "platform/host/BinaryPlistWriter.h"

namespace qax {

namespace {

// A drained buffer keeps up to this much memory for the next frames.
constexpr std::size_t kKeptBufferBytes = 4 * 1024;

}  // namespace

void IpcFrameCodec::append(std::string_view bytes) {
    // Drop what has been handed out before the buffer grows again.
    if (consumed_ == buffer_.size()) {
        buffer_.clear();
        consumed_ = 0;
    } else if (consumed_ > 0 && consumed_ >= buffer_.size() / 2) {
        buffer_.erase(0, consumed_);
        consumed_ = 0;
    }
    buffer_.append(bytes);
}

void IpcFrameCodec::release() {
    if (consumed_ != buffer_.size()) {
        return;
    }
    consumed_ = 0;
    if (buffer_.capacity() > kKeptBufferBytes) {
        std::string().swap(buffer_);
    } else {
        buffer_.clear();
    }
}

IpcFrameCodec::Status IpcFrameCodec::next(std::string_view& payload, std::string* error) {
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
    payload = std::string_view(buffer_).substr(consumed_ + kIpcFrameHeaderBytes, length);
    consumed_ += kIpcFrameHeaderBytes + length;
    return Status::Frame;
}

IpcFrameCodec::Status IpcFrameCodec::next(std::string& payload, std::string* error) {
    std::string_view view;
    const Status status = next(view, error);
    if (status == Status::Frame) {
        payload.assign(view);
    }
    return status;
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
    // Written after room for the header: the frame is one buffer, sent with one write.
    auto frame = BinaryPlistWriter::write(message, kIpcFrameHeaderBytes);
    if (!frame) {
        return std::nullopt;
    }
    const std::size_t length = frame->size() - kIpcFrameHeaderBytes;
    if (length > kMaxIpcFrameBytes) {
        return std::nullopt;
    }
    const auto n = static_cast<std::uint32_t>(length);
    (*frame)[0] = static_cast<char>((n >> 24) & 0xff);
    (*frame)[1] = static_cast<char>((n >> 16) & 0xff);
    (*frame)[2] = static_cast<char>((n >> 8) & 0xff);
    (*frame)[3] = static_cast<char>(n & 0xff);
    return frame;
}

}  // namespace qax
