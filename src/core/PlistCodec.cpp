#include "core/PlistCodec.h"

#include <plist/plist.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "core/IcuLibrary.h"

namespace qax {
namespace {

struct PlistDeleter {
    void operator()(plist_t p) const { plist_free(p); }
};
using PlistPtr = std::unique_ptr<void, PlistDeleter>;

void setError(std::string* error, std::string text) {
    if (error) {
        *error = std::move(text);
    }
}

// Element depth of an XML document: every opening tag that is not self-closing counts.
// The root <plist> element and the leaf element add two to the value depth.
bool xmlDepthIsSafe(std::string_view s, std::string* error) {
    int depth = 0;
    const int limit = kMaxValueDepth + 2;
    std::size_t i = 0;
    while ((i = s.find('<', i)) != std::string_view::npos) {
        if (s.substr(i, 4) == "<!--") {
            auto end = s.find("-->", i + 4);
            if (end == std::string_view::npos) {
                setError(error, "unterminated comment");
                return false;
            }
            i = end + 3;
            continue;
        }
        if (s.substr(i, 9) == "<![CDATA[") {
            auto end = s.find("]]>", i + 9);
            if (end == std::string_view::npos) {
                setError(error, "unterminated CDATA section");
                return false;
            }
            i = end + 3;
            continue;
        }
        auto close = s.find('>', i + 1);
        if (close == std::string_view::npos) {
            setError(error, "unterminated tag");
            return false;
        }
        std::string_view tag = s.substr(i + 1, close - i - 1);
        i = close + 1;
        if (tag.empty() || tag[0] == '?' || tag[0] == '!') {
            continue;
        }
        if (tag[0] == '/') {
            --depth;
        } else if (tag.back() != '/') {
            if (++depth > limit) {
                setError(error, "document nested deeper than " + std::to_string(kMaxValueDepth) +
                                    " levels");
                return false;
            }
        }
    }
    return true;
}

std::uint64_t readBigEndian(const unsigned char* p, std::size_t n) {
    std::uint64_t v = 0;
    for (std::size_t k = 0; k < n; ++k) {
        v = (v << 8) | p[k];
    }
    return v;
}

// The element count of the binary object at `off` (from its marker, or the integer after it)
// and where its content starts; false when the count's integer lies past `end`.
bool binaryObjectLength(const unsigned char* data, std::uint64_t end, std::uint64_t off,
                        std::uint64_t& count, std::uint64_t& pos) {
    count = data[off] & 0xF;
    pos = off + 1;
    if (count != 0xF) {
        return true;
    }
    if (pos >= end || (data[pos] >> 4) != 0x1) {
        return false;
    }
    const std::size_t n = std::size_t{1} << (data[pos] & 0xF);
    if (n > 8 || pos + 1 + n > end) {
        return false;
    }
    count = readBigEndian(data + pos + 1, n);
    pos += 1 + n;
    return true;
}

// Walks the object graph of a binary property list from its top object, checking every
// offset and reference, and refusing deep nesting (which also catches reference cycles)
// and graphs that expand to too many nodes through shared references.
bool binaryStructureIsSafe(std::string_view s, std::string* error) {
    const auto* data = reinterpret_cast<const unsigned char*>(s.data());
    const std::size_t size = s.size();
    if (size < 8 + 32) {
        setError(error, "binary property list too short");
        return false;
    }
    const unsigned char* trailer = data + size - 32;
    const std::size_t offsetSize = trailer[6];
    const std::size_t refSize = trailer[7];
    const std::uint64_t numObjects = readBigEndian(trailer + 8, 8);
    const std::uint64_t topObject = readBigEndian(trailer + 16, 8);
    const std::uint64_t tableOffset = readBigEndian(trailer + 24, 8);
    if (offsetSize < 1 || offsetSize > 8 || refSize < 1 || refSize > 8 || numObjects == 0 ||
        topObject >= numObjects || tableOffset < 8 || tableOffset >= size - 32 ||
        numObjects > (size - 32 - tableOffset) / offsetSize) {
        setError(error, "malformed binary property list trailer");
        return false;
    }
    auto objectOffset = [&](std::uint64_t index, std::uint64_t& out) {
        out = readBigEndian(data + tableOffset + index * offsetSize, offsetSize);
        return out >= 8 && out < tableOffset;
    };
    auto objectLength = [&](std::uint64_t off, std::uint64_t& count, std::uint64_t& pos) {
        return binaryObjectLength(data, tableOffset, off, count, pos);
    };
    // An ASCII or UTF-16 string inside the object area, without a NUL character.
    auto isPlainKey = [&](std::uint64_t index) {
        std::uint64_t off = 0, count = 0, pos = 0;
        if (!objectOffset(index, off) || !objectLength(off, count, pos)) {
            return false;
        }
        const unsigned type = data[off] >> 4;
        const std::uint64_t unit = type == 0x5 ? 1 : type == 0x6 ? 2 : 0;
        if (unit == 0 || count > (tableOffset - pos) / unit) {
            return false;
        }
        for (std::uint64_t i = 0; i < count; ++i) {
            const unsigned char* c = data + pos + i * unit;
            if (c[0] == 0 && (unit == 1 || c[1] == 0)) {
                return false;
            }
        }
        return true;
    };
    constexpr std::size_t kMaxVisits = 1'000'000;
    std::size_t visits = 0;
    struct Item {
        std::uint64_t index;
        int depth;
    };
    std::vector<Item> stack{{topObject, 1}};
    while (!stack.empty()) {
        Item item = stack.back();
        stack.pop_back();
        if (++visits > kMaxVisits) {
            setError(error, "binary property list expands to too many objects");
            return false;
        }
        if (item.depth > kMaxValueDepth + 1) {
            setError(error,
                     "document nested deeper than " + std::to_string(kMaxValueDepth) + " levels");
            return false;
        }
        std::uint64_t off = 0;
        if (!objectOffset(item.index, off)) {
            setError(error, "binary property list object offset out of range");
            return false;
        }
        const unsigned type = data[off] >> 4;
        if (type != 0xA && type != 0xC && type != 0xD) {
            continue;  // not a container
        }
        std::uint64_t count = 0, pos = 0;
        if (!objectLength(off, count, pos)) {
            setError(error, "malformed container length");
            return false;
        }
        const std::uint64_t refs = type == 0xD ? count * 2 : count;
        if (count > tableOffset || refs > (tableOffset - pos) / refSize) {
            setError(error, "container extends past the object table");
            return false;
        }
        for (std::uint64_t k = 0; k < refs; ++k) {
            std::uint64_t ref = readBigEndian(data + pos + k * refSize, refSize);
            if (ref >= numObjects) {
                setError(error, "object reference out of range");
                return false;
            }
            // libplist aborts the process on a dictionary key holding a NUL character.
            if (type == 0xD && k < count && !isPlainKey(ref)) {
                setError(error, "dictionary key is not a string without NUL characters");
                return false;
            }
            stack.push_back({ref, item.depth + 1});
        }
    }
    return true;
}

// The dates a property list can hold, in seconds from 2001: the library's are 32-bit, and
// the lowest is also what it reads a date beyond them as.
constexpr int32_t kEarliestDate = std::numeric_limits<int32_t>::min() + 1;
constexpr int32_t kLatestDate = std::numeric_limits<int32_t>::max();

// The seconds from 2001 a date node holds, as stored (the earliest date when they cannot be
// had): the library's accessor cuts them to 32 bits, its binary form keeps the double.
double storedDate(plist_t node) {
    char* bytes = nullptr;
    uint32_t length = 0;
    plist_to_bin(node, &bytes, &length);
    double seconds = std::numeric_limits<double>::quiet_NaN();
    // "bplist00", then the one object: 0x33 and a big-endian double.
    if (bytes && length >= 17 && static_cast<unsigned char>(bytes[8]) == 0x33) {
        uint64_t bits = 0;
        for (int i = 9; i < 17; ++i) {
            bits = bits << 8 | static_cast<unsigned char>(bytes[i]);
        }
        std::memcpy(&seconds, &bits, sizeof seconds);
    }
    std::free(bytes);
    return std::isnan(seconds) ? kEarliestDate : seconds;
}

// Text as a property list can store it again. libplist hands over a damaged file's bytes as
// they are, but writes non-ASCII strings of a binary file through UTF-16 and stops at the
// first byte that is not UTF-8, so keys and texts would be cut short on the next save. Such
// bytes become U+FFFD as they are read: what is read is what is written back.
std::string utf8FromPlist(const char* p, std::size_t n) {
    const auto* bytes = reinterpret_cast<const unsigned char*>(p);
    if (std::all_of(bytes, bytes + n, [](unsigned char c) { return c < 0x80; })) {
        return std::string(p, n);
    }
    const IcuLibrary* icu = IcuLibrary::get();
    if (!icu) {
        return std::string(p, n);
    }
    UErrorCode status = U_ZERO_ERROR;
    int32_t units = 0, substitutions = 0;
    std::u16string wide(n, u'\0');
    icu->strFromUTF8WithSub(wide.data(), static_cast<int32_t>(wide.size()), &units, p,
                            static_cast<int32_t>(n), 0xFFFD, &substitutions, &status);
    if (U_FAILURE(status) || substitutions == 0) {
        return std::string(p, n);
    }
    std::string text(static_cast<std::size_t>(units) * 3, '\0');
    int32_t length = 0;
    icu->strToUTF8(text.data(), static_cast<int32_t>(text.size()), &length, wide.data(), units,
                   &status);
    text.resize(U_SUCCESS(status) ? static_cast<std::size_t>(length) : 0);
    return text;
}

// A NUL character would end the text where the library writes it: it becomes U+FFFD too.
std::string textFromPlist(const char* p, std::size_t n) {
    std::string text = utf8FromPlist(p, n);
    for (std::size_t at = text.find('\0'); at != std::string::npos; at = text.find('\0', at)) {
        text.replace(at, 1, "\xEF\xBF\xBD");
    }
    return text;
}

std::optional<Value> fromPlist(plist_t node) {
    switch (plist_get_node_type(node)) {
        case PLIST_BOOLEAN: {
            uint8_t b = 0;
            plist_get_bool_val(node, &b);
            return Value(b != 0);
        }
        case PLIST_UINT: {
            uint64_t u = 0;
            plist_get_uint_val(node, &u);
            return Value(static_cast<long long>(u));
        }
        case PLIST_UID: {
            uint64_t u = 0;
            plist_get_uid_val(node, &u);
            return Value(static_cast<unsigned long long>(u));
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(node, &d);
            return Value(d);
        }
        case PLIST_STRING:
        case PLIST_KEY: {
            uint64_t len = 0;
            const char* p = plist_get_string_ptr(node, &len);
            return Value(p ? textFromPlist(p, len) : std::string());
        }
        case PLIST_DATE: {
            // The library hands out the seconds rounded toward zero and the size of the
            // fraction without its sign: a date before 2001 has its fraction taken away.
            int32_t sec = 0, usec = 0;
            plist_get_date_val(node, &sec, &usec);
            if (sec == std::numeric_limits<int32_t>::min()) {
                // Also what the seconds read as when the stored date is beyond them either
                // way (a damaged file): such a date is read as the nearest one that can be
                // written again, so a read file still saves.
                return Value(
                    Date(kSecondsFrom1970To2001 +
                         std::clamp(storedDate(node), double(kEarliestDate), double(kLatestDate))));
            }
            const double fraction = std::abs(usec) / 1e6;
            return Value(Date(kSecondsFrom1970To2001 + sec + (sec < 0 ? -fraction : fraction)));
        }
        case PLIST_DATA: {
            uint64_t len = 0;
            const char* p = plist_get_data_ptr(node, &len);
            const auto* b = reinterpret_cast<const std::uint8_t*>(p);
            return Value(Value::Data(b, b + (p ? len : 0)));
        }
        case PLIST_ARRAY: {
            Value::Array a;
            const uint32_t n = plist_array_get_size(node);
            a.reserve(n);
            for (uint32_t k = 0; k < n; ++k) {
                auto v = fromPlist(plist_array_get_item(node, k));
                if (!v) {
                    return std::nullopt;
                }
                a.push_back(std::move(*v));
            }
            return Value(std::move(a));
        }
        case PLIST_DICT: {
            Value::Dictionary d;
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(node, &it);
            for (;;) {
                char* key = nullptr;
                plist_t item = nullptr;
                plist_dict_next_item(node, it, &key, &item);
                if (!item) {
                    std::free(key);
                    break;
                }
                auto v = fromPlist(item);
                std::string k = key ? textFromPlist(key, std::strlen(key)) : std::string();
                std::free(key);
                if (!v) {
                    std::free(it);
                    return std::nullopt;
                }
                d.insert_or_assign(std::move(k), std::move(*v));
            }
            std::free(it);
            return Value(std::move(d));
        }
        default:
            return std::nullopt;
    }
}

// The common kind of binary property list, read without the library: arrays, dictionaries
// with text keys, integers of up to 8 bytes, booleans and ASCII text without NUL characters:
// what the agent's clients send, so a request costs no library tree. Only for a document
// binaryStructureIsSafe() accepted (its offsets, references and depth are checked there).
// Anything else is left to the library (none), which reads these kinds the same way.
class SimpleBinaryPlistReader {
  public:
    explicit SimpleBinaryPlistReader(std::string_view s)
        : data_(reinterpret_cast<const unsigned char*>(s.data())) {
        const unsigned char* trailer = data_ + s.size() - 32;
        offsetSize_ = trailer[6];
        refSize_ = trailer[7];
        numObjects_ = readBigEndian(trailer + 8, 8);
        topObject_ = readBigEndian(trailer + 16, 8);
        tableOffset_ = readBigEndian(trailer + 24, 8);
    }

    std::optional<Value> read() { return object(topObject_, 1); }

  private:
    std::optional<Value> object(std::uint64_t index, int depth) {
        if (index >= numObjects_ || depth > kMaxValueDepth + 1) {
            return std::nullopt;
        }
        const std::uint64_t off =
            readBigEndian(data_ + tableOffset_ + index * offsetSize_, offsetSize_);
        if (off < 8 || off >= tableOffset_) {
            return std::nullopt;
        }
        const unsigned marker = data_[off];
        switch (marker >> 4) {
            case 0x0:
                if (marker == 0x08 || marker == 0x09) {
                    return Value(marker == 0x09);
                }
                return std::nullopt;
            case 0x1: {
                const std::size_t n = std::size_t{1} << (marker & 0xF);
                if (n > 8 || off + 1 + n > tableOffset_) {
                    return std::nullopt;
                }
                return Value(static_cast<long long>(readBigEndian(data_ + off + 1, n)));
            }
            case 0x5: {
                std::uint64_t count = 0, pos = 0;
                if (!length(off, count, pos) || count > tableOffset_ - pos) {
                    return std::nullopt;
                }
                const auto* text = reinterpret_cast<const char*>(data_ + pos);
                if (!std::all_of(text, text + count,
                                 [](unsigned char c) { return c >= 0x01 && c <= 0x7F; })) {
                    return std::nullopt;
                }
                return Value(std::string(text, count));
            }
            case 0xA:
            case 0xD: {
                const bool isDictionary = (marker >> 4) == 0xD;
                std::uint64_t count = 0, pos = 0;
                if (!length(off, count, pos)) {
                    return std::nullopt;
                }
                const std::uint64_t refs = isDictionary ? count * 2 : count;
                if (count > tableOffset_ || refs > (tableOffset_ - pos) / refSize_) {
                    return std::nullopt;
                }
                auto ref = [&](std::uint64_t k) {
                    return readBigEndian(data_ + pos + k * refSize_, refSize_);
                };
                if (!isDictionary) {
                    Value::Array array;
                    array.reserve(count);
                    for (std::uint64_t k = 0; k < count; ++k) {
                        auto element = object(ref(k), depth + 1);
                        if (!element) {
                            return std::nullopt;
                        }
                        array.push_back(std::move(*element));
                    }
                    return Value(std::move(array));
                }
                Value::Dictionary dictionary;
                for (std::uint64_t k = 0; k < count; ++k) {
                    auto key = object(ref(k), depth + 1);
                    auto element = object(ref(count + k), depth + 1);
                    if (!key || !key->isString() || !element) {
                        return std::nullopt;
                    }
                    dictionary.insert_or_assign(std::move(*key->asString()), std::move(*element));
                }
                return Value(std::move(dictionary));
            }
            default:
                return std::nullopt;
        }
    }

    bool length(std::uint64_t off, std::uint64_t& count, std::uint64_t& pos) const {
        return binaryObjectLength(data_, tableOffset_, off, count, pos);
    }

    const unsigned char* data_;
    std::size_t offsetSize_ = 0, refSize_ = 0;
    std::uint64_t numObjects_ = 0, topObject_ = 0, tableOffset_ = 0;
};

plist_t toPlist(const Value& v) {
    switch (v.kind()) {
        case Value::Kind::Null:
            return nullptr;
        case Value::Kind::Bool:
            return plist_new_bool(*v.asBool() ? 1 : 0);
        case Value::Kind::Integer:
            return plist_new_uint(static_cast<uint64_t>(*v.asInteger()));
        case Value::Kind::Real:
            return plist_new_real(*v.asDouble());
        case Value::Kind::String:
            return plist_new_string(v.asString()->c_str());
        case Value::Kind::Date: {
            double rel = v.asDate()->secondsSince1970() - kSecondsFrom1970To2001;
            // Within the second before 2001 the fraction's sign cannot be read back (the
            // seconds read as 0): such a date is kept as the whole second before.
            if (rel > -1 && rel < 0) {
                rel = -1;
            }
            double sec = std::floor(rel);
            if (!std::isfinite(sec) || rel <= std::numeric_limits<int32_t>::min() ||
                sec > kLatestDate) {
                return nullptr;
            }
            auto usec = static_cast<int32_t>(std::llround((rel - sec) * 1e6));
            if (usec >= 1000000) {
                usec = 999999;
            }
            return plist_new_date(static_cast<int32_t>(sec), usec);
        }
        case Value::Kind::Data: {
            const auto& d = *v.asData();
            return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
        }
        case Value::Kind::Array: {
            PlistPtr a(plist_new_array());
            for (const auto& e : *v.asArray()) {
                plist_t item = toPlist(e);
                if (!item) {
                    return nullptr;
                }
                plist_array_append_item(a.get(), item);
            }
            return a.release();
        }
        case Value::Kind::Dictionary: {
            PlistPtr d(plist_new_dict());
            for (const auto& [k, e] : *v.asDictionary()) {
                plist_t item = toPlist(e);
                if (!item) {
                    return nullptr;
                }
                plist_dict_set_item(d.get(), k.c_str(), item);
            }
            return d.release();
        }
    }
    return nullptr;
}

}  // namespace

bool isBinaryPlist(std::string_view bytes) {
    return bytes.starts_with("bplist00");
}

bool plistStructureIsSafe(std::string_view bytes, std::string* error) {
    if (bytes.empty()) {
        setError(error, "empty document");
        return false;
    }
    if (bytes.size() > kMaxPlistBytes) {
        setError(error, "document larger than " + std::to_string(kMaxPlistBytes) + " bytes");
        return false;
    }
    return isBinaryPlist(bytes) ? binaryStructureIsSafe(bytes, error)
                                : xmlDepthIsSafe(bytes, error);
}

std::optional<Value> parsePlist(std::string_view bytes, std::string* error) {
    if (!plistStructureIsSafe(bytes, error)) {
        return std::nullopt;
    }
    if (isBinaryPlist(bytes)) {
        if (auto simple = SimpleBinaryPlistReader(bytes).read()) {
            return simple;
        }
    }
    return parsePlistWithLibrary(bytes, error);
}

std::optional<Value> parsePlistWithLibrary(std::string_view bytes, std::string* error) {
    if (!plistStructureIsSafe(bytes, error)) {
        return std::nullopt;
    }
    plist_t root = nullptr;
    if (isBinaryPlist(bytes)) {
        plist_from_bin(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
    } else {
        plist_from_xml(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
    }
    if (!root) {
        setError(error, "not a property list");
        return std::nullopt;
    }
    PlistPtr guard(root);
    auto value = fromPlist(root);
    if (!value) {
        setError(error, "property list holds an unsupported node");
    }
    return value;
}

std::optional<std::string> toXmlPlist(const Value& value) {
    PlistPtr root(toPlist(value));
    if (!root) {
        return std::nullopt;
    }
    char* out = nullptr;
    uint32_t len = 0;
    plist_to_xml(root.get(), &out, &len);
    if (!out) {
        return std::nullopt;
    }
    std::string s(out, len);
    plist_to_xml_free(out);
    // The document type line is optional and only names the DTD's publisher; leave it out.
    if (auto start = s.find("<!DOCTYPE"); start != std::string::npos) {
        if (auto end = s.find(">\n", start); end != std::string::npos) {
            s.erase(start, end + 2 - start);
        }
    }
    return s;
}

std::optional<std::string> toBinaryPlist(const Value& value) {
    PlistPtr root(toPlist(value));
    if (!root) {
        return std::nullopt;
    }
    char* out = nullptr;
    uint32_t len = 0;
    plist_to_bin(root.get(), &out, &len);
    if (!out) {
        return std::nullopt;
    }
    std::string s(out, len);
    plist_to_bin_free(out);
    return s;
}

}  // namespace qax
