#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>

#include "HostilePropertyLists.h"
#include "PrivateBus.h"
#include "TestSupport.h"
#include "plist/PropertyListBounds.h"
#include "plist/PropertyListFormat.h"
#include "plist/Value.h"

namespace tavrix::plist {
namespace {

Value sampleTree() {
    Dictionary nested{{"empty dictionary", Dictionary{}}, {"empty array", Array{}}};
    return Dictionary{
        {"negative", Value(-42)},
        {"minimum", Value(Integer(INT64_MIN))},
        {"largest unsigned", Value(Integer::fromUnsigned(UINT64_MAX))},
        {"real", Value(-0.1)},
        {"true", Value(true)},
        {"false", Value(false)},
        {"date", Value(Date{123456})},
        {"date before the reference", Value(Date{-86401})},
        {"non-ASCII \xc3\xa9t\xc3\xa9", Value("\xe6\x97\xa5\xe6\x9c\xac <&> \"quoted\"")},
        {"data", Value(Data{0x00, 0xff, 0x10, 0x80})},
        {"empty data", Value(Data{})},
        {"empty string", Value("")},
        {"nested", Value(nested)},
        {"array", Value(Array{Value(1), Value("two"), Value(Array{}), Value(Dictionary{})})},
    };
}

class EitherFormat : public testing::TestWithParam<Format> {};

// Every type and edge value, nested or at the top, comes back as written, and a second trip gives
// the same bytes; any cut of the bytes is no value. XML has its header and no DOCTYPE. (Other
// programs' XML is read in the external readers' test.)
TEST_P(EitherFormat, RoundTripKeepsEveryTypeAndEdgeValue) {
    for (const Value& original :
         {sampleTree(), Value("just a string"), Value(7), Value(Date{1}), Value(true)}) {
        std::string bytes = *serialize(original, GetParam());
        auto back = parse(bytes);
        ASSERT_TRUE(back) << original.description();
        EXPECT_EQ(*back, original) << back->description();
        EXPECT_EQ(*serialize(*back, GetParam()), bytes);
    }
    std::string bytes = *serialize(sampleTree(), GetParam());
    EXPECT_EQ(bytes.find("DOCTYPE"), std::string::npos);
    EXPECT_EQ(bytes.rfind(GetParam() == Format::Xml ? "<?xml" : "bplist00", 0), 0u);
    for (std::size_t cut :
         {std::size_t{0}, std::size_t{1}, bytes.size() / 3, bytes.size() / 2, bytes.size() - 9}) {
        EXPECT_FALSE(parse(std::string_view(bytes).substr(0, cut))) << cut;
    }
    // Nothing is encoded that the reader would refuse: one node too many, one level too deep.
    auto tooMany = serialize(Value(Array(kMaxPropertyListNodes, Value(1))), GetParam());
    ASSERT_FALSE(tooMany);
    EXPECT_NE(tooMany.reason(), "");
    Value deep(1);
    for (std::size_t depth = 1; depth <= kMaxPropertyListDepth; ++depth) {
        deep = Value(Array{std::move(deep)});
    }
    EXPECT_FALSE(serialize(deep, GetParam()));
}

// Dates far from the reference date (past 2038, before 1901) keep their value and their text on
// every machine, a 32-bit time_t's included; beyond year 9999, which the XML form cannot spell,
// they are clamped.
TEST(PropertyListDates, XmlHoldsWholeSecondsAndBinaryKeepsFractions) {
    for (auto [seconds, text] : {std::pair{123456.75, "2001-01-02T10:17:36Z"},
                                 std::pair{-86400.25, "2000-12-30T23:59:59Z"},
                                 std::pair{3124137600.5, "2100-01-01T00:00:00Z"},
                                 std::pair{-6328670400.0, "1800-06-15T12:00:00Z"}}) {
        Value date(Date{seconds});
        std::string xml = *serialize(date, Format::Xml);
        EXPECT_NE(xml.find(std::string("<date>") + text + "</date>"), std::string::npos) << xml;
        EXPECT_EQ(parse(xml), Value(Date{std::floor(seconds)}));
        EXPECT_EQ(parse(*serialize(date, Format::Binary)), date);
        std::string readable = text;
        readable[10] = ' ';
        EXPECT_EQ(date.description(), readable.replace(19, 1, " +0000"));
    }
    EXPECT_NE(serialize(Value(Date{1e15}))->find("<date>9999-12-31T23:59:59Z</date>"),
              std::string::npos);
}

// Other programs read what this one writes: Python's plistlib and libplist's own converter each
// turn the file into XML of their own, which must read back as the value written.
TEST_P(EitherFormat, ExternalReadersReadTheFilesWritten) {
    test::TempDir dir;
    Value tree = sampleTree();
    ASSERT_TRUE(writeFile(dir / "written.plist", tree, GetParam()));
    const std::string python =
        "python3 -c 'import plistlib,sys; "
        "plistlib.dump(plistlib.load(open(sys.argv[1],\"rb\")), open(sys.argv[2],\"wb\"))' ";
    const std::string converters[] = {
        python + "'" + (dir / "written.plist") + "' '" + (dir / "python.plist") + "'",
        "plistutil -f xml -i '" + (dir / "written.plist") + "' -o '" + (dir / "plistutil.plist") +
            "'"};
    for (const std::string& command : converters) {
        SCOPED_TRACE(command);
        if (std::system(
                (command.substr(0, command.find(' ')) + " --version >/dev/null 2>&1").c_str()) !=
            0) {
            GTEST_SKIP() << "not installed (scripts/install-deps.sh installs it)";
        }
        ASSERT_EQ(std::system(command.c_str()), 0);
    }
    for (const char* name : {"python.plist", "plistutil.plist"}) {
        auto back = readFile(dir / name);
        ASSERT_TRUE(back) << name;
        EXPECT_EQ(*back, tree) << name << "\n" << back->description();
    }
}

INSTANTIATE_TEST_SUITE_P(BothFormats, EitherFormat, testing::Values(Format::Xml, Format::Binary),
                         [](const testing::TestParamInfo<Format>& info) {
                             return info.param == Format::Xml ? "Xml" : "Binary";
                         });

// Whatever a file holds, reading it answers promptly with a value or a reason, never waits, runs
// out of memory or crashes. (FIFOs and deep or self-sharing nesting are refused on the real daemon
// too.)
TEST(PropertyListDamage, HostileFilesAreRefusedWithAReason) {
    test::TempDir dir;
    const std::string path = dir / "file";
    const std::pair<std::string, const char*> cases[] = {
        {"-> /dev/zero", "not a regular file"},
        {std::string(kMaxPropertyListBytes + 1, ' '), "larger than"},
        // Attribute text ending in "/>" makes libplist read the arrays as open elements.
        {test::nestedXml(600, " x=\"/>\""), "deeper than 512"},
        {test::binaryList({test::arrayOf({0})}), "contains itself"},
        // A dictionary whose key is "a\0b" (0x53, 'S': an ASCII string of three).
        {test::binaryList(
             {std::string("\xD1\x00\x01\x00\x02", 5), std::string("Sa\0b", 4), "\x09"}),
         "NUL"},
        {test::binaryList({test::arrayOf({7})}), "no object"},
        {test::nestedXml(3).substr(0, 20), "not a complete XML property list"},
    };
    for (const auto& [content, reason] : cases) {
        std::filesystem::remove(path);
        content.starts_with("-> ") ? std::filesystem::create_symlink(content.substr(3), path)
                                   : test::writeText(path, content);
        EXPECT_THAT(readFile(path).reason(), testing::HasSubstr(reason));
    }
    // Just inside the limits, shared binary objects and deep nesting still read.
    EXPECT_TRUE(parse(test::nestedXml(512)));
    EXPECT_TRUE(parse(test::nestedBinaryList(511, 1)));
    EXPECT_TRUE(parse(test::nestedBinaryList(15, 2)));
    EXPECT_FALSE(parse(test::nestedXml(513)));
    EXPECT_FALSE(parse(test::nestedBinaryList(512, 1)));
}

// tavrix-plist in a pipeline, as scripts use it: "-" for standard input and output, and JSON that
// Python's json module reads with every kind of value still apart.
TEST(PlistTool, PipesThroughStandardStreamsAndKeepsTypesInJson) {
    test::TempDir directory;
    const std::string source = directory / "in.plist";
    test::writeText(source,
                    "<plist version=\"1.0\"><dict><key>n</key><integer>1500</integer>"
                    "<key>s</key><string>1500</string><key>r</key><real>1500</real>"
                    "<key>d</key><data>AAEC/w==</data>"
                    "<key>t</key><date>2040-02-29T23:49:17.25Z</date></dict></plist>");
    const std::string tool = "'" TAVRIX_PLIST_TOOL "'";
    // XML in, binary through a pipe, typed JSON out, read by Python; the date past 2038 keeps its
    // fraction and its text with a 32-bit time_t too.
    test::CommandResult piped = test::runCommand(
        {"/bin/bash", "-c",
         "set -o pipefail; " + tool + " --binary '" + source + "' - | " + tool +
             " --json=pretty - | /usr/bin/python3 -c 'import json, sys; v = json.load(sys.stdin); "
             "print(repr(v[\"n\"]), repr(v[\"s\"]), repr(v[\"r\"]), v[\"d\"], v[\"t\"])'"});
    EXPECT_EQ(piped.status, 0) << piped.output;
    EXPECT_EQ(piped.output,
              "1500 '1500' 1500.0 {'$data': 'AAEC/w=='} {'$date': '2040-02-29T23:49:17.25Z'}\n");

    test::CommandResult refused =
        test::runCommand({"/bin/bash", "-c", "echo 'not a plist' | " + tool + " -"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(refused.output,
              "tavrix-plist: standard input: it is not a complete XML property list\n");
}

}  // namespace
}  // namespace tavrix::plist
