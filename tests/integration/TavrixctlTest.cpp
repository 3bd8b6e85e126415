// tavrixctl as scripts use it: exit statuses, and its one JSON form read by Python's json module,
// where a date, data, an integer, a real and the same digits as text all stay apart.
#include <gmock/gmock.h>

#include "BusFixture.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

using ::testing::HasSubstr;

class TavrixctlTest : public BusFixture {
  protected:
    CommandResult tavrixctl(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {TAVRIX_CTL_PATH, "--address=" + busAddress()});
        return runCommand(arguments);
    }

    // tavrixctl's answer with Python's expression applied to the parsed JSON as "answer"; the
    // exit status is tavrixctl's.
    CommandResult throughPython(const std::vector<std::string>& arguments,
                                const std::string& expression) {
        std::string line = "set -o pipefail; '" + std::string(TAVRIX_CTL_PATH) + "' --address='" +
                           busAddress() + "'";
        for (const std::string& argument : arguments) {
            line += " '" + argument + "'";
        }
        line += " | /usr/bin/python3 -c 'import json, sys; answer = json.load(sys.stdin); print(" +
                expression + ")'";
        return runCommand({"/bin/bash", "-c", line});
    }
};

TEST_F(TavrixctlTest, ScriptsGetExitStatusesAndTypedJson) {
    device().writeDaemonPreferences({{"EnableSupport", true}});
    ASSERT_TRUE(client().setTavrixID("acme.default", pack([&] {
                                         const auto source = device().base() / "src";
                                         writeBundle(source, "1", {{"CarrierName", "One"}});
                                         return source;
                                     }())));
    // Binary, which keeps a date's fraction; in one step, as the daemon caches by identity.
    const plist::Dictionary settings = {{"Count", 1500},
                                        {"Text", "1500"},
                                        {"Ratio", 1.0},
                                        {"Blob", plist::Data{0, 1, 2, 0xff}},
                                        {"When", plist::Date{1.25}},
                                        {"Nested", plist::Dictionary{{"$date", "not a date"}}}};
    const auto settingsFile = at(kPreferencesLink);
    ASSERT_TRUE(plist::writeFile(settingsFile.string() + ".new", plist::Value(settings),
                                 plist::Format::Binary));
    std::filesystem::rename(settingsFile.string() + ".new", settingsFile);

    // No command is the status.
    CommandResult status = tavrixctl({});
    EXPECT_EQ(status.status, 0) << status.output;
    EXPECT_THAT(status.output, HasSubstr("acme.default"));

    CommandResult typed = throughPython({"value", "Count", "--json=pretty"},
                                        "answer[\"Key\"], repr(answer[\"Value\"])");
    EXPECT_EQ(typed.output, "Count 1500\n");
    auto valueOf = [&](const std::string& key) {
        return throughPython({"--json", "value", key}, "json.dumps(answer[\"Value\"])").output;
    };
    EXPECT_EQ(valueOf("Text"), "\"1500\"\n");
    EXPECT_EQ(valueOf("Ratio"), "1.0\n");
    EXPECT_EQ(valueOf("Blob"), "{\"$data\": \"AAEC/w==\"}\n");
    EXPECT_EQ(valueOf("When"), "{\"$date\": \"2001-01-01T00:00:01.25Z\"}\n");
    EXPECT_EQ(valueOf("Nested"), "{\"$dictionary\": {\"$date\": \"not a date\"}}\n");

    CommandResult missing = throughPython({"value", "NoSuchKey", "--json"}, "answer[\"Value\"]");
    EXPECT_EQ(missing.status, 1);
    EXPECT_EQ(missing.output, "None\n");
    EXPECT_EQ(tavrixctl({"value", "NoSuchKey"}).status, 1);

    // show: as systemctl's, one property or several, with or without names.
    CommandResult one = tavrixctl({"show", "-p", "BehaviorID", "--value"});
    EXPECT_EQ(one.status, 0);
    EXPECT_EQ(one.output, "acme.default\n");
    CommandResult several =
        tavrixctl({"show", "-p", "Supported,LinkedBundleVersion", "--property=LastCheckUSec"});
    EXPECT_EQ(several.output, "Supported=yes\nLinkedBundleVersion=1\nLastCheckUSec=\n");
    CommandResult shown = throughPython(
        {"show", "--json"},
        "answer[\"BehaviorID\"], answer[\"LastPayloadExtracted\"], "
        "answer[\"LastPayloadUSec\"][\"$date\"].endswith(\"Z\"), answer[\"LastCheckUSec\"]");
    EXPECT_EQ(shown.status, 0) << shown.output;
    EXPECT_EQ(shown.output, "acme.default True True None\n");
    CommandResult unknown = tavrixctl({"show", "-p", "NoSuchProperty"});
    EXPECT_EQ(unknown.status, 1);
    EXPECT_THAT(unknown.output, HasSubstr("no property NoSuchProperty"));

    // Usage mistakes: 2, with one line.
    for (const std::vector<std::string>& mistake :
         {std::vector<std::string>{"--json=long", "status"},
          {"supported", "--bundle", "x"},
          {"no-such-command"},
          {"check-update", "--wait"},
          {"client-type", "-5"}}) {
        CommandResult refused = tavrixctl(mistake);
        EXPECT_EQ(refused.status, 2) << mistake.front() << ": " << refused.output;
    }
    EXPECT_EQ(tavrixctl({"client-type", "--", "-5"}).output, "yes\n");
}

}  // namespace
}  // namespace tavrix::integration
