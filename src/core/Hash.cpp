#include "core/Hash.h"

#include <array>

#include <openssl/evp.h>

namespace qax {

std::array<std::uint8_t, 32> sha256(std::span<const std::uint8_t> bytes) {
    // Fetched once: looking the algorithm up by name cost more than hashing a serial number.
    static EVP_MD* const fetched = EVP_MD_fetch(nullptr, "SHA256", nullptr);
    std::array<std::uint8_t, 32> digest{};
    EVP_Digest(bytes.data(), bytes.size(), digest.data(), nullptr, fetched ? fetched : EVP_sha256(),
               nullptr);
    return digest;
}

std::string sha256Hash(std::string_view text) {
    if (auto zero = text.find('\0'); zero != std::string_view::npos) {
        text = text.substr(0, zero);
    }
    // Serial numbers are hashed several times in each request (file names, preference keys,
    // follow-up identifiers): the last few short texts hashed on this thread are remembered.
    struct Remembered {
        std::string text;
        std::string hash;
    };
    constexpr std::size_t kRemembered = 8;
    constexpr std::size_t kLongestRemembered = 64;
    thread_local std::array<Remembered, kRemembered> remembered;
    thread_local std::size_t next = 0;
    const bool remember = text.size() <= kLongestRemembered;
    if (remember) {
        for (const auto& r : remembered) {
            if (!r.hash.empty() && r.text == text) {
                return r.hash;
            }
        }
    }
    auto digest = sha256(std::span<const std::uint8_t>(
        reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
    static const char* hex = "0123456789abcdef";
    std::string out;
    out.reserve(64);
    for (auto b : digest) {
        out += hex[b >> 4];
        out += hex[b & 15];
    }
    if (remember) {
        remembered[next] = {std::string(text), out};
        next = (next + 1) % kRemembered;
    }
    return out;
}

}  // namespace qax
