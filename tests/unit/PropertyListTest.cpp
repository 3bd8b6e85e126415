#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdlib>
#include <functional>

#include "TestSupport.h"
#include "plist/PropertyListFormat.h"
#include "plist/Value.h"
#include "util/PropertyListFile.h"
#include "util/SystemLog.h"

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
// the same bytes; any cut of the bytes is no value.
TEST_P(EitherFormat, RoundTripKeepsEveryTypeAndEdgeValue) {
    for (const Value& original :
         {sampleTree(), Value("just a string"), Value(7), Value(Date{1}), Value(true)}) {
        std::string bytes = serialize(original, GetParam());
        auto back = parse(bytes);
        ASSERT_TRUE(back.has_value()) << original.description();
        EXPECT_EQ(*back, original) << back->description();
        EXPECT_EQ(serialize(*back, GetParam()), bytes);
    }
    std::string bytes = serialize(sampleTree(), GetParam());
    for (std::size_t cut :
         {std::size_t{0}, std::size_t{1}, bytes.size() / 3, bytes.size() / 2, bytes.size() - 9}) {
        EXPECT_FALSE(parse(std::string_view(bytes).substr(0, cut)).has_value()) << cut;
    }
}

// (Other programs' XML of every type is read in the external readers' test.)
TEST(PropertyListXml, ReadsValuesWrittenByOthers) {
    auto value = parse(
        "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
        "<key>big</key><integer>18446744073709551615</integer>"
        "<key>when</key><date>2001-01-02T00:00:00.5Z</date>"
        "<key>whole</key><date>2001-01-01T00:01:00Z</date>"
        "</dict></plist>");
    ASSERT_TRUE(value.has_value());
    EXPECT_DOUBLE_EQ(value->find("when")->asDate()->secondsSinceReferenceDate, 86400.5);
    EXPECT_DOUBLE_EQ(value->find("whole")->asDate()->secondsSinceReferenceDate, 60.0);
    // The large unsigned value is written back as it was read, with no DOCTYPE.
    std::string xml = serialize(*value);
    EXPECT_NE(xml.find("<integer>18446744073709551615</integer>"), std::string::npos);
    EXPECT_EQ(xml.find("DOCTYPE"), std::string::npos);
    EXPECT_EQ(xml.rfind("<?xml", 0), 0u);
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
        std::string xml = serialize(date, Format::Xml);
        EXPECT_NE(xml.find(std::string("<date>") + text + "</date>"), std::string::npos) << xml;
        EXPECT_EQ(parse(xml), Value(Date{std::floor(seconds)}));
        EXPECT_EQ(parse(serialize(date, Format::Binary)), date);
        std::string readable = text;
        readable[10] = ' ';
        EXPECT_EQ(date.description(), readable.replace(19, 1, " +0000"));
    }
    EXPECT_NE(serialize(Value(Date{1e15})).find("<date>9999-12-31T23:59:59Z</date>"),
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
        ASSERT_TRUE(back.has_value()) << name;
        EXPECT_EQ(*back, tree) << name << "\n" << back->description();
    }
}

INSTANTIATE_TEST_SUITE_P(BothFormats, EitherFormat, testing::Values(Format::Xml, Format::Binary),
                         [](const testing::TestParamInfo<Format>& info) {
                             return info.param == Format::Xml ? "Xml" : "Binary";
                         });

// A binary property list of the given encoded objects, the first one at the top, with 4-byte
// offsets and 2-byte references.
std::string binaryList(const std::vector<std::string>& objects) {
    std::string bytes = "bplist00";
    std::string table;
    auto bigEndian = [](std::uint64_t value, int width) {
        std::string out;
        for (int shift = (width - 1) * 8; shift >= 0; shift -= 8) {
            out += static_cast<char>((value >> shift) & 0xff);
        }
        return out;
    };
    for (const std::string& object : objects) {
        table += bigEndian(bytes.size(), 4);
        bytes += object;
    }
    std::uint64_t tableOffset = bytes.size();
    bytes += table;
    bytes += std::string(6, '\0') + '\x04' + '\x02';
    bytes += bigEndian(objects.size(), 8) + bigEndian(0, 8) + bigEndian(tableOffset, 8);
    return bytes;
}

// An array object referring to the given objects (fewer than 15).
std::string arrayOf(std::initializer_list<std::uint16_t> refs) {
    std::string object(1, static_cast<char>(0xA0 | refs.size()));
    for (std::uint16_t ref : refs) {
        object += static_cast<char>(ref >> 8);
        object += static_cast<char>(ref & 0xff);
    }
    return object;
}

std::string nestedXml(int depth) {
    std::string xml = "<plist>";
    for (int i = 0; i < depth; ++i) {
        xml += "<array>";
    }
    for (int i = 0; i < depth; ++i) {
        xml += "</array>";
    }
    return xml + "</plist>";
}

// Arrays whose attribute text ends in "/>": libplist reads them as open elements.
std::string quotedSlashXml(int depth) {
    std::string xml = "<plist>";
    for (int i = 0; i < depth; ++i) {
        xml += "<array x=\"/>\">";
    }
    for (int i = 0; i < depth; ++i) {
        xml += "</array>";
    }
    return xml + "</plist>";
}

// depth arrays inside each other (a chain), or each referring twice to the next one (shared).
std::string binaryChain(int length, bool shared) {
    std::vector<std::string> objects;
    for (int i = 0; i + 1 < length; ++i) {
        auto next = static_cast<std::uint16_t>(i + 1);
        objects.push_back(shared ? arrayOf({next, next}) : arrayOf({next}));
    }
    objects.push_back("\x51x");
    return binaryList(objects);
}

// Whatever a file holds, reading it answers promptly with a value or a reason, never waits, runs
// out of memory or crashes; the daemon's reader logs the reason with the file's name. (FIFOs and
// deep or self-sharing nesting are refused on the real daemon too.)
TEST(PropertyListDamage, HostileFilesAreRefusedWithAReason) {
    test::TempDir dir;
    struct Case {
        const char* name;
        std::function<void(const std::string& path)> make;
        const char* reason;
    };
    auto bytes = [](std::string content) {
        return [content](const std::string& path) { test::writeText(path, content); };
    };
    const std::vector<Case> cases{
        {"device behind a link",
         [](const std::string& path) { std::filesystem::create_symlink("/dev/zero", path); },
         "not a regular file"},
        {"a byte over the cap", bytes(std::string(kMaxPropertyListBytes + 1, ' ')), "larger than"},
        {"deep XML whose tags look self-closing", bytes(quotedSlashXml(600)), "deeper than 512"},
        {"binary array inside itself", bytes(binaryList({arrayOf({0})})), "contains itself"},
        {"binary key with a NUL",
         bytes(binaryList({std::string("\xD1\x00\x01\x00\x02", 5),
                           std::string("\x53"
                                       "a\0b",
                                       4),
                           "\x09"})),
         "NUL"},
        {"binary offset past the end", bytes(binaryList({arrayOf({7})})), "no object"},
        {"XML cut short", bytes(nestedXml(3).substr(0, 20)), "not a complete XML property list"},
    };
    CapturingLogSink sink;
    ScopedLogSink capture(sink);
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        std::string path = dir / (std::string(c.name) + ".plist");
        c.make(path);
        Refusal refusal;
        EXPECT_FALSE(readFile(path, &refusal).has_value());
        EXPECT_THAT(refusal.reason, testing::HasSubstr(c.reason));
        sink.clear();
        EXPECT_FALSE(readPropertyListFile(path).has_value());
        EXPECT_EQ(sink.messages(), std::vector<std::string>{"Property list " + path + " refused: " +
                                                            refusal.reason + "; ignoring it"});
    }
    // Just inside the limits, shared binary objects and deep nesting still read.
    EXPECT_TRUE(parse(nestedXml(512)).has_value());
    EXPECT_TRUE(parse(binaryChain(512, false)).has_value());
    EXPECT_TRUE(parse(binaryChain(16, true)).has_value());
    EXPECT_FALSE(parse(nestedXml(513)).has_value());
    EXPECT_FALSE(parse(binaryChain(513, false)).has_value());
}

}  // namespace
}  // namespace tavrix::plist
