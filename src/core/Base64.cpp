#include "core/Base64.h"

#include <openssl/evp.h>

namespace qax {

std::string base64Encode(std::span<const std::uint8_t> bytes) {
    std::string out(4 * ((bytes.size() + 2) / 3), '\0');
    if (bytes.empty()) {
        return out;
    }
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data()), bytes.data(),
                            static_cast<int>(bytes.size()));
    out.resize(static_cast<std::size_t>(n));
    return out;
}

std::string base64Encode(std::string_view bytes) {
    return base64Encode(std::span<const std::uint8_t>(
        reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()));
}

std::optional<std::vector<std::uint8_t>> base64Decode(std::string_view text) {
    if (text.size() % 4 != 0) {
        return std::nullopt;
    }
    std::vector<std::uint8_t> out(text.size() / 4 * 3);
    if (text.empty()) {
        return out;
    }
    int n = EVP_DecodeBlock(out.data(), reinterpret_cast<const unsigned char*>(text.data()),
                            static_cast<int>(text.size()));
    if (n < 0) {
        return std::nullopt;
    }
    // EVP_DecodeBlock counts the padding as zero bytes; drop them.
    std::size_t len = static_cast<std::size_t>(n);
    if (text.ends_with("==")) {
        len -= 2;
    } else if (text.ends_with("=")) {
        len -= 1;
    }
    out.resize(len);
    return out;
}

}  // namespace qax
