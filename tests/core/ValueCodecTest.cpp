#include <gtest/gtest.h>

#include <string>

#include "core/JsonCodec.h"
#include "core/PlistCodec.h"

namespace qax {
namespace {

std::string nested(const std::string& open, const std::string& close, int depth,
                   const std::string& leaf) {
    std::string s;
    for (int i = 0; i < depth; ++i) {
        s += open;
    }
    s += leaf;
    for (int i = 0; i < depth; ++i) {
        s += close;
    }
    return s;
}

TEST(ValueCodec, JsonToPlistAndBackKeepsEveryKind) {
    const char* docs[] = {
        R"({"covered": true, "count": 7, "ratio": 2.5, "name": "Model9,1"})",
        R"({"big": 9007199254740993, "negative": -42, "zero": 0, "half": -0.5})",
        R"({"ms": 1700000000000, "s": 1700000000, "real": 1700000000.9})",
        R"({"nested": {"a": [1, 2, {"b": [true, false, "x"]}], "empty": {}, "list": []}})",
        R"({"unicode": "Gar\u00e9 \u2603", "quote": "a \"b\" \\ c"})",
    };
    for (const char* text : docs) {
        SCOPED_TRACE(text);
        auto v = parseJson(text);
        ASSERT_TRUE(v);
        auto xml = toXmlPlist(*v);
        auto bin = toBinaryPlist(*v);
        ASSERT_TRUE(xml);
        ASSERT_TRUE(bin);
        auto fromXml = parsePlist(*xml);
        auto fromBin = parsePlist(*bin);
        ASSERT_TRUE(fromXml);
        ASSERT_TRUE(fromBin);
        EXPECT_EQ(*fromXml, *v);
        EXPECT_EQ(*fromBin, *v);
        // Integers stay integers and reals stay reals through both encodings.
        for (const auto& [key, value] : *v->asDictionary()) {
            EXPECT_EQ(fromXml->find(key)->kind(), value.kind()) << key;
            EXPECT_EQ(fromBin->find(key)->kind(), value.kind()) << key;
        }
        EXPECT_EQ(parseJson(toJsonString(*fromBin)), v);
    }
}

TEST(ValueCodec, DatesAndDataSurvivePropertyLists) {
    Value tree(Value::Dictionary{
        {"when", Value(Date(1700000000.25))},
        {"before2001", Value(Date(86400.0))},
        {"bytes", Value(Value::Data{0, 1, 2, 254, 255})},
        {"emptyBytes", Value(Value::Data{})},
    });
    // XML dates carry whole seconds; binary dates keep the fraction.
    struct Encoding {
        std::optional<std::string> (*encode)(const Value&);
        double precision;
    } encodings[] = {{&toXmlPlist, 1.0}, {&toBinaryPlist, 1e-3}};
    for (const auto& [encode, precision] : encodings) {
        auto doc = encode(tree);
        ASSERT_TRUE(doc);
        auto back = parsePlist(*doc);
        ASSERT_TRUE(back);
        EXPECT_EQ(*back->find("bytes"), *tree.find("bytes"));
        EXPECT_EQ(*back->find("emptyBytes"), *tree.find("emptyBytes"));
        EXPECT_NEAR(back->find("when")->asDate()->secondsSince1970(), 1700000000.25, precision);
        EXPECT_EQ(back->find("before2001")->asDate()->secondsSince1970(), 86400.0);
    }
    // A JSON rendering names dates in ISO 8601 and data in base64.
    EXPECT_EQ(toJsonString(Value::Dictionary{{"d", Value(Date(1700000000))},
                                             {"b", Value(Value::Data{1, 2, 3})}}),
              R"({"b":"AQID","d":"2023-11-14T22:13:20.000Z"})");
}

TEST(ValueCodec, NullHasNoPropertyListForm) {
    for (const char* text : {"null", R"({"a": null})", R"({"a": [1, {"b": null}]})"}) {
        SCOPED_TRACE(text);
        auto v = parseJson(text);
        ASSERT_TRUE(v);
        EXPECT_FALSE(toXmlPlist(*v));
        EXPECT_FALSE(toBinaryPlist(*v));
    }
    // Dates beyond what the format stores are refused too, rather than wrapped.
    EXPECT_FALSE(toXmlPlist(Value(Date(1e13))));
}

TEST(ValueCodec, ReadsHandWrittenXmlPlist) {
    const char* xml = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<dict>
  <!-- engineers edit these files by hand -->
  <key>SerialNumber</key><string>C02DEMO</string>
  <key>InternalBuild</key><true/>
  <key>Count</key><integer>-3</integer>
  <key>Ratio</key><real>0.5</real>
  <key>Paired</key><date>2024-01-02T03:04:05Z</date>
  <key>Blob</key><data>AQID</data>
  <key>Empty</key><dict/>
  <key>List</key><array><string>a</string><integer>1</integer></array>
</dict>
</plist>)";
    auto v = parsePlist(xml);
    ASSERT_TRUE(v);
    EXPECT_EQ(*v->find("SerialNumber"), Value("C02DEMO"));
    EXPECT_EQ(*v->find("InternalBuild"), Value(true));
    EXPECT_EQ(*v->find("Count"), Value(-3));
    EXPECT_TRUE(v->find("Ratio")->isReal());
    EXPECT_EQ(v->find("Paired")->asDate()->iso8601(), "2024-01-02T03:04:05.000Z");
    EXPECT_EQ(*v->find("Blob"), Value(Value::Data{1, 2, 3}));
    EXPECT_EQ(*v->find("Empty"), Value::Dictionary{});
    EXPECT_EQ(v->find("List")->size(), 2u);
}

TEST(ValueCodec, HostileDocumentsAreRefusedBeforeParsing) {
    // At the limit a document parses; past it, it is refused instead of crashing the parser.
    EXPECT_TRUE(parseJson(nested("[", "]", kMaxValueDepth, "1")));
    EXPECT_FALSE(parseJson(nested("[", "]", kMaxValueDepth + 1, "1")));
    EXPECT_FALSE(parseJson(nested("[", "]", 100000, "1")));

    const std::string head = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
    EXPECT_TRUE(
        parsePlist(head + nested("<array>", "</array>", kMaxValueDepth, "<true/>") + "</plist>"));
    std::string error;
    EXPECT_FALSE(
        parsePlist(head + nested("<array>", "</array>", 100000, "<true/>") + "</plist>", &error));
    EXPECT_NE(error.find("nested"), std::string::npos);

    // A binary document nested too deeply, made by our own writer.
    Value deep(1);
    for (int i = 0; i < kMaxValueDepth + 5; ++i) {
        deep = Value::Array{deep};
    }
    auto bin = toBinaryPlist(deep);
    ASSERT_TRUE(bin);
    EXPECT_FALSE(parsePlist(*bin));

    // Damaged binary documents: every truncation and a corrupt trailer are refused safely.
    auto good = toBinaryPlist(Value::Dictionary{{"a", Value(Value::Array{1, 2, 3})}});
    ASSERT_TRUE(good);
    for (std::size_t n = 0; n < good->size(); n += 3) {
        (void)parsePlist(good->substr(0, n));  // must not crash
    }
    std::string corrupt = *good;
    corrupt[corrupt.size() - 9] = '\x7f';  // offset table far past the end
    EXPECT_FALSE(parsePlist(corrupt));

    EXPECT_FALSE(parsePlist(""));
    EXPECT_FALSE(parsePlist("<html><body>Not Found</body></html>"));
    EXPECT_FALSE(parseJson("<html>"));
}

TEST(ValueEquality, NumbersCompareByValue) {
    EXPECT_EQ(Value(1), Value(1.0));
    EXPECT_NE(Value(1), Value(1.5));
    EXPECT_NE(Value(true), Value(1));
    EXPECT_NE(Value("1"), Value(1));
    EXPECT_EQ(Value(Value::Array{1, 2.0}), Value(Value::Array{1.0, 2}));
    EXPECT_NE(Value(Value::Dictionary{{"a", 1}}), Value(Value::Dictionary{{"b", 1}}));
}

TEST(ValueDescription, ReadsLikeTheLogsShowIt) {
    Value v(Value::Dictionary{{"HighServerVersion", 3},
                              {"name", "Default Device"},
                              {"list", Value(Value::Array{1, "a b"})},
                              {"none", Value(Value::Array{})},
                              {"quote", "a \"b\" \\ c\nd"},
                              {"when", Date(1700000000)}});
    EXPECT_EQ(v.description(),
              "{\n    HighServerVersion = 3;\n    list = (\n        1,\n        \"a b\"\n    );\n"
              "    name = \"Default Device\";\n    none = ();\n"
              "    quote = \"a \\\"b\\\" \\\\ c\\nd\";\n"
              "    when = \"2023-11-14 22:13:20 +0000\";\n}");
    EXPECT_EQ(Value("plain text").description(), "plain text");
    EXPECT_EQ(Value(Date(1700000000)).description(), "2023-11-14 22:13:20 +0000");
}

}  // namespace
}  // namespace qax
