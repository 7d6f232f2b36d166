#include "platform/host/BinaryPlistWriter.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstdint>
#include <limits>
#include <string_view>
#include <vector>

namespace qax {
namespace {

constexpr std::string_view kMagic = "bplist00";
constexpr double kSecondsFrom1970To2001 = 978307200;
constexpr std::size_t kTrailerBytes = 32;
constexpr char32_t kReplacementCharacter = 0xFFFD;

enum Marker : std::uint8_t {
    kFalse = 0x08,
    kTrue = 0x09,
    kInteger = 0x10,
    kReal8 = 0x23,
    kDate = 0x33,
    kData = 0x40,
    kAsciiString = 0x50,
    kUtf16String = 0x60,
    kArray = 0xA0,
    kDictionary = 0xD0,
};

// The tree in object order (each container before its children), with the object numbers of
// every container's children.
struct Objects {
    struct Object {
        const Value* value = nullptr;  // none: a dictionary key
        std::string_view key;
        std::size_t firstRef = 0;
    };
    std::vector<Object> list;
    std::vector<std::uint64_t> refs;
    // Bytes of strings and data, to size the output once.
    std::size_t payloadBytes = 0;

    // False when the tree holds a null, which has no binary form.
    bool add(const Value& v, std::uint64_t& number) {
        number = list.size();
        list.push_back({&v, {}, refs.size()});
        if (const auto* text = v.asString()) {
            payloadBytes += text->size();
        } else if (const auto* data = v.asData()) {
            payloadBytes += data->size();
        } else if (const auto* array = v.asArray()) {
            const std::size_t first = refs.size();
            refs.resize(first + array->size());
            for (std::size_t i = 0; i < array->size(); ++i) {
                std::uint64_t child = 0;
                if (!add((*array)[i], child)) {
                    return false;
                }
                refs[first + i] = child;
            }
        } else if (const auto* dictionary = v.asDictionary()) {
            const std::size_t n = dictionary->size();
            const std::size_t first = refs.size();
            refs.resize(first + 2 * n);
            std::size_t i = 0;
            for (const auto& [key, item] : *dictionary) {
                refs[first + i] = list.size();
                list.push_back({nullptr, key, 0});
                payloadBytes += key.size();
                std::uint64_t child = 0;
                if (!add(item, child)) {
                    return false;
                }
                refs[first + n + i] = child;
                ++i;
            }
        }
        return !v.isNull();
    }
};

void appendBigEndian(std::string& out, std::uint64_t v, std::size_t bytes) {
    char buffer[8];
    for (std::size_t i = 0; i < bytes; ++i) {
        buffer[i] = static_cast<char>((v >> (8 * (bytes - 1 - i))) & 0xff);
    }
    out.append(buffer, bytes);
}

std::size_t bytesFor(std::uint64_t v) {
    return v <= 0xff ? 1 : v <= 0xffff ? 2 : v <= 0xffffffffu ? 4 : 8;
}

void appendInteger(std::string& out, std::int64_t v) {
    // Negative numbers are written in eight bytes, two's complement.
    const auto u = static_cast<std::uint64_t>(v);
    const std::size_t n = v < 0 ? 8 : bytesFor(u);
    out += static_cast<char>(kInteger | std::countr_zero(n));
    appendBigEndian(out, u, n);
}

void appendMarker(std::string& out, std::uint8_t marker, std::size_t count) {
    if (count < 15) {
        out += static_cast<char>(marker | count);
        return;
    }
    out += static_cast<char>(marker | 0x0f);
    appendInteger(out, static_cast<std::int64_t>(count));
}

void appendDouble(std::string& out, std::uint8_t marker, double d) {
    out += static_cast<char>(marker);
    appendBigEndian(out, std::bit_cast<std::uint64_t>(d), 8);
}

// The next code point of UTF-8 text; an invalid sequence reads as one replacement character
// per byte.
char32_t nextCodePoint(std::string_view s, std::size_t& i) {
    const auto byte = [&](std::size_t k) { return static_cast<unsigned char>(s[k]); };
    const unsigned char b0 = byte(i);
    std::size_t length = b0 >= 0xf0 ? 4 : b0 >= 0xe0 ? 3 : b0 >= 0xc0 ? 2 : 1;
    char32_t c = length == 4 ? b0 & 0x07 : length == 3 ? b0 & 0x0f : b0 & 0x1f;
    if (length == 1 || b0 > 0xf4 || i + length > s.size()) {
        ++i;
        return b0 < 0x80 ? b0 : kReplacementCharacter;
    }
    for (std::size_t k = 1; k < length; ++k) {
        if ((byte(i + k) & 0xc0) != 0x80) {
            ++i;
            return kReplacementCharacter;
        }
        c = (c << 6) | (byte(i + k) & 0x3f);
    }
    static constexpr char32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
    if (c < kSmallest[length] || c > 0x10ffff || (c >= 0xd800 && c <= 0xdfff)) {
        ++i;
        return kReplacementCharacter;
    }
    i += length;
    return c;
}

void appendString(std::string& out, std::string_view s) {
    s = s.substr(0, s.find('\0'));
    const bool ascii = std::all_of(s.begin(), s.end(),
                                   [](char c) { return static_cast<unsigned char>(c) < 0x80; });
    if (ascii) {
        appendMarker(out, kAsciiString, s.size());
        out.append(s);
        return;
    }
    std::vector<char16_t> units;
    units.reserve(s.size());
    for (std::size_t i = 0; i < s.size();) {
        const char32_t c = nextCodePoint(s, i);
        if (c > 0xffff) {
            units.push_back(static_cast<char16_t>(0xd800 + ((c - 0x10000) >> 10)));
            units.push_back(static_cast<char16_t>(0xdc00 + ((c - 0x10000) & 0x3ff)));
        } else {
            units.push_back(static_cast<char16_t>(c));
        }
    }
    appendMarker(out, kUtf16String, units.size());
    for (char16_t u : units) {
        appendBigEndian(out, u, 2);
    }
}

// Dates are stored as seconds since 2001 rounded to the microsecond, within 32-bit seconds.
bool appendDate(std::string& out, Date date) {
    const double relative = date.secondsSince1970() - kSecondsFrom1970To2001;
    const double seconds = std::floor(relative);
    if (!std::isfinite(seconds) || seconds < std::numeric_limits<std::int32_t>::min() ||
        seconds > std::numeric_limits<std::int32_t>::max()) {
        return false;
    }
    auto micro = std::llround((relative - seconds) * 1e6);
    if (micro >= 1000000) {
        micro = 999999;
    }
    appendDouble(out, kDate, seconds + static_cast<double>(micro) / 1000000);
    return true;
}

bool appendObject(std::string& out, const Objects& objects, const Objects::Object& object,
                  std::size_t refBytes) {
    if (!object.value) {
        appendString(out, object.key);
        return true;
    }
    const Value& v = *object.value;
    switch (v.kind()) {
        case Value::Kind::Null:
            return false;
        case Value::Kind::Bool:
            out += static_cast<char>(*v.asBool() ? kTrue : kFalse);
            return true;
        case Value::Kind::Integer:
            appendInteger(out, *v.asInteger());
            return true;
        case Value::Kind::Real:
            appendDouble(out, kReal8, *v.asDouble());
            return true;
        case Value::Kind::String:
            appendString(out, *v.asString());
            return true;
        case Value::Kind::Date:
            return appendDate(out, *v.asDate());
        case Value::Kind::Data: {
            const auto& data = *v.asData();
            appendMarker(out, kData, data.size());
            out.append(reinterpret_cast<const char*>(data.data()), data.size());
            return true;
        }
        case Value::Kind::Array:
        case Value::Kind::Dictionary: {
            const std::size_t count = v.size();
            const bool isArray = v.isArray();
            appendMarker(out, isArray ? kArray : kDictionary, count);
            const std::size_t refs = isArray ? count : 2 * count;
            for (std::size_t i = 0; i < refs; ++i) {
                appendBigEndian(out, objects.refs[object.firstRef + i], refBytes);
            }
            return true;
        }
    }
    return false;
}

}  // namespace

std::optional<std::string> BinaryPlistWriter::write(const Value& value, std::size_t headroom) {
    Objects objects;
    std::uint64_t top = 0;
    if (!objects.add(value, top)) {
        return std::nullopt;
    }
    const std::size_t refBytes = bytesFor(objects.list.size());
    std::string out(headroom, '\0');
    // Markers, lengths, numbers and references take at most 16 bytes an object, and a string
    // of n bytes at most 2n as UTF-16.
    out.reserve(headroom + kMagic.size() + 2 * objects.payloadBytes +
                (16 + 2 * refBytes) * objects.list.size() + kTrailerBytes);
    out.append(kMagic);
    std::vector<std::uint64_t> offsets;
    offsets.reserve(objects.list.size());
    for (const auto& object : objects.list) {
        offsets.push_back(out.size() - headroom);
        if (!appendObject(out, objects, object, refBytes)) {
            return std::nullopt;
        }
    }
    const std::uint64_t tableOffset = out.size() - headroom;
    const std::size_t offsetBytes = bytesFor(offsets.empty() ? 0 : offsets.back());
    for (std::uint64_t offset : offsets) {
        appendBigEndian(out, offset, offsetBytes);
    }
    out.append(6, '\0');  // unused, sort version
    out += static_cast<char>(offsetBytes);
    out += static_cast<char>(refBytes);
    appendBigEndian(out, objects.list.size(), 8);
    appendBigEndian(out, top, 8);
    appendBigEndian(out, tableOffset, 8);
    return out;
}

}  // namespace qax
