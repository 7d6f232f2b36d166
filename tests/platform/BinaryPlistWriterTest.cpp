// The IPC stream's own binary property-list writer: whatever it writes, the general reader
// reads back as the value the general codec's writer would have given, and it refuses what that
// writer refuses.
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "core/PlistCodec.h"
#include "platform/host/BinaryPlistWriter.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {
namespace {

Value arrayOf(std::size_t n) {
    Value::Array a;
    for (std::size_t i = 0; i < n; ++i) {
        a.emplace_back(static_cast<long long>(i));
    }
    return Value(std::move(a));
}

TEST(BinaryPlistWriterTest, ReadsBackAsTheGeneralCodecsDocument) {
    const Value values[] = {
        Value(true),
        Value(false),
        Value(0),
        Value(255),
        Value(256),
        Value(65535),
        Value(65536),
        Value(4294967295LL),
        Value(4294967296LL),
        Value(std::numeric_limits<long long>::max()),
        Value(-1),
        Value(std::numeric_limits<long long>::min()),
        Value(0.5),
        Value(-1e300),
        Value(""),
        Value("fourteen chars"),
        Value("fifteen chars!!"),
        Value(std::string(300, 'x')),
        Value("caf\xc3\xa9 \xe6\x97\xa5\xe6\x9c\xac \xf0\x9f\x98\x80"),
        Value(std::string("before\0after", 12)),
        Value(Date(0)),
        Value(Date(1700000000.1234564)),
        Value(Date(1700000000.9999996)),
        Value(Date(-1e9)),
        Value(Value::Data{}),
        Value(Value::Data(40, 0xab)),
        Value::Array{},
        Value::Dictionary{},
        Value::Dictionary{
            {"id", Value(7)},
            {"reply", Value(Value::Dictionary{{"$class", "QAXDevice"},
                                              {"name", "Watch"},
                                              {"activationDate", Date(1700000000)},
                                              {"list", Value::Array{Value(1), Value("two")}}})}},
        arrayOf(300),  // two-byte object references
    };
    for (const Value& v : values) {
        const auto ours = BinaryPlistWriter::write(v);
        const auto theirs = toBinaryPlist(v);
        ASSERT_TRUE(ours && theirs) << v.description().substr(0, 80);
        EXPECT_EQ(parsePlist(*ours), parsePlist(*theirs)) << v.description().substr(0, 80);
        // Plain documents are read without the library: the same values either way.
        EXPECT_EQ(parsePlist(*ours), parsePlistWithLibrary(*ours)) << v.description().substr(0, 80);
    }
}

// Damaged documents too: every byte of a request changed in several ways, and the direct
// reading answers as the library does (the same value, or none).
TEST(BinaryPlistWriterTest, DirectReadingAgreesWithTheLibraryOnDamagedDocuments) {
    const Value requests[] = {
        Value::Dictionary{{"id", Value(1)}, {"op", "defaultDevice:"}, {"args", Value::Array{}}},
        Value::Dictionary{{"id", Value(300)},
                          {"op", "getAllDeviceInfosUsingPolicy:updateFollowUps:withReply:"},
                          {"args", Value::Array{Value(2), Value(true), Value("C02SERIAL")}}},
        arrayOf(20),
    };
    int compared = 0;
    for (const Value& request : requests) {
        const auto bytes = BinaryPlistWriter::write(request);
        ASSERT_TRUE(bytes);
        for (std::size_t at = 0; at < bytes->size(); ++at) {
            for (const unsigned char change : {0x01, 0x0F, 0x10, 0x80, 0xFF}) {
                std::string damaged = *bytes;
                damaged[at] = static_cast<char>(static_cast<unsigned char>(damaged[at]) ^ change);
                EXPECT_EQ(parsePlist(damaged), parsePlistWithLibrary(damaged))
                    << "byte " << at << " ^ " << int(change);
                ++compared;
            }
        }
    }
    EXPECT_GT(compared, 1000);
}

TEST(BinaryPlistWriterTest, RefusesWhatHasNoPropertyListForm) {
    const Value values[] = {
        Value(),
        Value::Array{Value(1), Value()},
        Value::Dictionary{{"a", Value(Value::Dictionary{{"b", Value()}})}},
        Value(Date(1e12)),
        Value(Date(std::numeric_limits<double>::quiet_NaN())),
    };
    for (const Value& v : values) {
        EXPECT_FALSE(BinaryPlistWriter::write(v)) << v.description();
        EXPECT_FALSE(toBinaryPlist(v)) << v.description();
    }
}

TEST(BinaryPlistWriterTest, FramesCarryTheirLengthAndInvalidTextReadsAsReplacement) {
    const Value message(Value::Dictionary{{"id", Value(1)}, {"error", "bad \xff byte"}});
    auto frame = IpcFrameCodec::encode(message);
    ASSERT_TRUE(frame);
    IpcFrameCodec decoder;
    decoder.append(*frame);
    std::string payload;
    ASSERT_EQ(decoder.next(payload), IpcFrameCodec::Status::Frame);
    EXPECT_FALSE(decoder.hasPartialFrame());
    EXPECT_EQ(parsePlist(payload),
              (Value::Dictionary{{"id", Value(1)}, {"error", "bad \xef\xbf\xbd byte"}}));
}

}  // namespace
}  // namespace qax
