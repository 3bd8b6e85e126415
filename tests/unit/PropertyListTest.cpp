#include <gtest/gtest.h>

#include <climits>

#include "TestSupport.h"
#include "plist/PropertyListFormat.h"
#include "plist/Value.h"

namespace tavrix::plist {
namespace {

Value sampleTree() {
    Dictionary nested{{"empty dictionary", Dictionary{}}, {"empty array", Array{}}};
    return Dictionary{
        {"negative", Value(-42)},
        {"minimum", Value(Integer(INT64_MIN))},
        {"large unsigned", Value(Integer::fromUnsigned(UINT64_MAX - 1))},
        {"real", Value(-0.1)},
        {"true", Value(true)},
        {"false", Value(false)},
        {"fractional date", Value(Date{123456.25})},
        {"date before the reference", Value(Date{-86400.125})},
        {"non-ASCII \xc3\xa9t\xc3\xa9", Value("\xe6\x97\xa5\xe6\x9c\xac <&> \"quoted\"")},
        {"data", Value(Data{0x00, 0xff, 0x10, 0x80})},
        {"empty data", Value(Data{})},
        {"empty string", Value("")},
        {"nested", Value(nested)},
        {"array", Value(Array{Value(1), Value("two"), Value(Array{}), Value(Dictionary{})})},
    };
}

class RoundTrip : public testing::TestWithParam<Format> {};

TEST_P(RoundTrip, KeepsEveryTypeAndEdgeValue) {
    Value original = sampleTree();
    std::string bytes = serialize(original, GetParam());
    ASSERT_FALSE(bytes.empty());
    auto back = parse(bytes);
    ASSERT_TRUE(back.has_value());
    EXPECT_EQ(*back, original) << back->description();
    // And a second trip gives the same bytes: nothing drifts.
    EXPECT_EQ(serialize(*back, GetParam()), bytes);
}

TEST_P(RoundTrip, KeepsScalarsAtTheTop) {
    for (const Value& value : {Value("just a string"), Value(7), Value(Date{0.5}), Value(true)}) {
        auto back = parse(serialize(value, GetParam()));
        ASSERT_TRUE(back.has_value());
        EXPECT_EQ(*back, value);
    }
}

INSTANTIATE_TEST_SUITE_P(BothFormats, RoundTrip, testing::Values(Format::Xml, Format::Binary),
                         [](const testing::TestParamInfo<Format>& info) {
                             return info.param == Format::Xml ? "Xml" : "Binary";
                         });

TEST(PropertyListXml, ReadsValuesWrittenByOthers) {
    auto value = parse(
        "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
        "<key>big</key><integer>18446744073709551615</integer>"
        "<key>neg</key><integer>-7</integer>"
        "<key>when</key><date>2001-01-02T00:00:00.5Z</date>"
        "<key>whole</key><date>2001-01-01T00:01:00Z</date>"
        "<key>blob</key><data>AAEC</data>"
        "</dict></plist>");
    ASSERT_TRUE(value.has_value());
    EXPECT_EQ(value->find("big")->asInteger()->unsignedValue(), UINT64_MAX);
    EXPECT_TRUE(value->find("big")->asInteger()->isLargeUnsigned());
    EXPECT_EQ(value->find("neg")->asInteger()->signedValue(), -7);
    EXPECT_DOUBLE_EQ(value->find("when")->asDate()->secondsSinceReferenceDate, 86400.5);
    EXPECT_DOUBLE_EQ(value->find("whole")->asDate()->secondsSinceReferenceDate, 60.0);
    EXPECT_EQ(*value->find("blob")->asData(), (Data{0, 1, 2}));
    // The large unsigned value is written back as it was read.
    EXPECT_NE(serialize(*value).find("<integer>18446744073709551615</integer>"), std::string::npos);
}

TEST(PropertyListXml, WritesNoDoctype) {
    std::string xml = serialize(Value(Dictionary{{"a", Value(1)}}));
    EXPECT_EQ(xml.find("DOCTYPE"), std::string::npos);
    EXPECT_EQ(xml.rfind("<?xml", 0), 0u);
}

TEST(PropertyListDamage, TruncatedOrGarbageInputIsNoValue) {
    Value tree = sampleTree();
    for (Format format : {Format::Xml, Format::Binary}) {
        std::string bytes = serialize(tree, format);
        for (std::size_t cut :
             {std::size_t{1}, bytes.size() / 3, bytes.size() / 2, bytes.size() - 9}) {
            EXPECT_FALSE(parse(std::string_view(bytes).substr(0, cut)).has_value())
                << "format " << static_cast<int>(format) << " cut at " << cut;
        }
    }
    for (std::string_view garbage :
         {std::string_view(""), std::string_view("bplist00"),
          std::string_view("<plist><dict><key>a"), std::string_view("\x00\x01\x02\x03", 4),
          std::string_view("<plist><integer>x</integer>")}) {
        auto value = parse(garbage);
        // Either nothing or some value, but never a crash; the empty and truncated ones are
        // nothing.
        if (garbage.size() < 20) {
            EXPECT_FALSE(value.has_value()) << garbage;
        }
    }
}

TEST(PropertyListDamage, DeepNestingIsRefusedNotOverflowed) {
    std::string xml = "<plist>";
    for (int i = 0; i < 5000; ++i) {
        xml += "<array>";
    }
    for (int i = 0; i < 5000; ++i) {
        xml += "</array>";
    }
    xml += "</plist>";
    EXPECT_FALSE(parse(xml).has_value());
}

TEST(PropertyListFiles, WriteThenReadThroughASymbolicLink) {
    test::TempDir dir;
    Value tree = sampleTree();
    ASSERT_TRUE(writeFile(dir / "real.plist", tree, Format::Binary));
    std::filesystem::create_symlink(dir / "real.plist", dir / "link.plist");
    auto back = readFile(dir / "link.plist");
    ASSERT_TRUE(back.has_value());
    EXPECT_EQ(*back, tree);
    EXPECT_FALSE(readFile(dir / "missing.plist").has_value());
    EXPECT_FALSE(readFile(dir.path().string()).has_value());  // a directory is not a file
}

TEST(PropertyListValue, CopiesAreDeepAndIndependent) {
    Value original = sampleTree();
    Value copy = original;
    copy.find("nested")->asDictionary()->insert_or_assign("added", Value(1));
    copy.find("array")->asArray()->push_back(Value("more"));
    EXPECT_NE(copy, original);
    EXPECT_EQ(original, sampleTree());
}

TEST(PropertyListValue, TypesNeverCompareEqualAcrossKinds) {
    EXPECT_NE(Value(1), Value(1.0));
    EXPECT_NE(Value(1), Value(true));
    EXPECT_NE(Value(""), Value(Data{}));
    EXPECT_NE(Value(Dictionary{}), Value(Array{}));
    EXPECT_NE(Value(Date{0}), Value(0.0));
}

TEST(PropertyListValue, DescriptionIsReadable) {
    Value value = Dictionary{{"name", Value("carrier one")},
                             {"list", Value(Array{Value(1), Value(true)})},
                             {"blob", Value(Data{0xab, 0xcd})},
                             {"when", Value(Date{0})}};
    EXPECT_EQ(value.description(),
              "{\n"
              "    blob = {length = 2, bytes = 0xabcd};\n"
              "    list = (\n"
              "        1,\n"
              "        true\n"
              "    );\n"
              "    name = \"carrier one\";\n"
              "    when = 2001-01-01 00:00:00 +0000;\n"
              "}");
    EXPECT_EQ(Value("plain text").description(), "plain text");
    EXPECT_EQ(describe(nullptr), "(null)");
}

}  // namespace
}  // namespace tavrix::plist
