// SHA-256 digests (OpenSSL). Stateless; any thread.
#pragma once

#include <array>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

namespace qax {

std::array<std::uint8_t, 32> sha256(std::span<const std::uint8_t> bytes);

// The hexadecimal digest the agent stores instead of a clear serial number: SHA-256 of the
// string's UTF-8 bytes up to the first zero byte, as 64 lower-case hexadecimal digits.
std::string sha256Hash(std::string_view text);

}  // namespace qax
