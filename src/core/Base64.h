// Base64 with the standard alphabet, padded, without line breaks (OpenSSL's codec).
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace qax {

std::string base64Encode(std::span<const std::uint8_t> bytes);
std::string base64Encode(std::string_view bytes);
// No value when the text is not padded base64 of the standard alphabet.
std::optional<std::vector<std::uint8_t>> base64Decode(std::string_view text);

}  // namespace qax
