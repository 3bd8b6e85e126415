// The daemon as programs the project did not write see it: busctl reads the properties (its JSON
// read by a JSON library), Python hands the daemon a bundle by file descriptor and reads
// tavrixctl's JSON; the property changes and the check signal are followed on the bus.
#include <fcntl.h>
#include <gmock/gmock.h>

#include <nlohmann/json.hpp>

#include "BusFixture.h"
#include "TestSupport.h"
#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;
using nlohmann::json;
using ::testing::HasSubstr;
using ::testing::StartsWith;

class StatusPropertiesTest : public BusFixture {
  protected:
    void SetUp() override {
        BusFixture::SetUp();
        device().writeDaemonPreferences({{"EnableSupport", true}});
    }

    // busctl on the test's bus; through the shell, so that arguments may redirect descriptors.
    CommandResult busctl(const std::string& arguments) {
        return runCommand({"/bin/sh", "-c",
                           "exec /usr/bin/busctl --address='" + busAddress() + "' " + arguments});
    }
    CommandResult getProperties(const std::string& names) {
        return busctl("get-property " + std::string(kDaemonBusName) + " " + kDaemonObjectPath +
                      " " + kStatusInterface + " " + names);
    }
    // SetTavrixIDWithBundleFD through Python's dbus module; how is "file" (the file opened),
    // "pipe" (its content written to a pipe that is then closed), "open-pipe" (the writer still
    // open) or "device" (/dev/null). Prints the answer as JSON, or the error's name and message.
    CommandResult sendBundle(const std::string& id, const std::string& how,
                             const fs::path& file = "/dev/null") {
        return runCommand({"/usr/bin/python3", "-c", R"(import dbus, json, os, sys
address, id, how, path = sys.argv[1:]
bus = dbus.bus.BusConnection(address)
daemon = bus.get_object("com.zandor.tavrixservicesd", "/com/zandor/tavrixservicesd")
if how == "file" or how == "device":
    fd = os.open(path, os.O_RDONLY)
else:
    fd, writer = os.pipe()
    if how == "pipe":
        os.write(writer, open(path, "rb").read())
        os.close(writer)
try:
    answer = daemon.SetTavrixIDWithBundleFD(id, dbus.types.UnixFd(fd),
                                            dbus_interface="com.zandor.TXManagerServerInterface")
except dbus.exceptions.DBusException as error:
    print(error.get_dbus_name(), error.get_dbus_message())
    sys.exit(1)
print(json.dumps([bool(answer[0]), bool(answer[1]), str(answer[2])])))",
                           busAddress(), id, how, file.string()});
    }
};

// Read before any set, then a bundle by descriptor: the properties and GetAll agree with what
// PropertiesChanged announced; a check ends with its signal after its properties.
TEST_F(StatusPropertiesTest, PropertiesAnnounceEachChangeAndTakeABundleByDescriptor) {
    CommandResult before = getProperties("BehaviorID Supported WhyNotSupported LastPayloadUSec");
    EXPECT_EQ(before.status, 0) << before.output;
    EXPECT_EQ(before.output, "s \"\"\nb false\ns \"no behavior ID has been set\"\nt 0\n");
    CommandResult unknown = getProperties("NoSuchProperty");
    EXPECT_NE(unknown.status, 0);
    EXPECT_THAT(unknown.output, HasSubstr("NoSuchProperty"));

    const fs::path bundle = device().base() / "bundle.tgz";
    const auto packed = pack(writeVersionedBundle("1"));
    test::writeText(bundle, std::string(packed.begin(), packed.end()));
    CommandResult set = sendBundle("ACME.Default", "file", bundle);
    EXPECT_EQ(set.status, 0) << set.output;
    EXPECT_EQ(json::parse(set.output),
              json({true, true,
                    "extracted " + std::to_string(packed.size()) + " bytes into the user bundle"}));
    auto announced = watcher().waitForStatus({{"BehaviorID", "acme.default"},
                                              {"Supported", true},
                                              {"WhyNotSupported", ""},
                                              {"LinkedBundleVersion", "1"},
                                              {"UserBundleVersion", "1"},
                                              {"LastPayloadExtracted", true}});
    ASSERT_TRUE(announced);
    EXPECT_GT((*announced)["LastPayloadUSec"].get<std::uint64_t>(), 0u);
    EXPECT_EQ((*announced)["LinkedBundlePath"], at(kUserBundle).string());

    CommandResult getAll =
        busctl("--json=short call " + std::string(kDaemonBusName) + " " + kDaemonObjectPath +
               " org.freedesktop.DBus.Properties GetAll s " + kStatusInterface);
    EXPECT_EQ(getAll.status, 0) << getAll.output;
    json all = json::parse(getAll.output)["data"][0];
    EXPECT_EQ(all.size(), 18u) << all.dump();
    for (const auto& [name, value] : announced->items()) {
        EXPECT_EQ(all[name]["data"], value) << name;
    }
    EXPECT_EQ(all["NextUpdateCheckUSec"]["type"], "t");
    EXPECT_EQ(all["DaemonVersion"]["type"], "s");
    EXPECT_EQ(all["LastCheckOutcome"]["data"], "");

    const fs::path garbage = device().base() / "garbage.tgz";
    test::writeText(garbage, "not an archive");
    // Through a pipe: read without waiting for a writer, so only a finished one is taken.
    CommandResult broken = sendBundle("acme.default", "pipe", garbage);
    EXPECT_EQ(broken.status, 0) << broken.output;
    EXPECT_EQ(json::parse(broken.output)[1], false) << broken.output;
    announced = watcher().waitForStatus({{"LastPayloadExtracted", false}});
    ASSERT_TRUE(announced);
    EXPECT_NE((*announced)["LastPayloadReason"], "");

    for (const char* how : {"open-pipe", "device"}) {
        CommandResult refused = sendBundle("other", how);
        EXPECT_EQ(refused.status, 1) << how;
        EXPECT_THAT(refused.output, StartsWith("org.freedesktop.DBus.Error.InvalidArgs Bundle "
                                               "refused: "))
            << how;
    }
    // The client library tells the refusal by its name and category.
    io::UniqueFd devNull(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    try {
        client().setTavrixIDWithBundleFile("other", devNull.get());
        ADD_FAILURE() << "a device was taken as a bundle";
    } catch (const client::ClientError& error) {
        EXPECT_EQ(error.category(), client::ErrorCategory::InvalidArguments);
        EXPECT_EQ(error.errorName(), "org.freedesktop.DBus.Error.InvalidArgs");
    }
    EXPECT_EQ(getProperties("BehaviorID").output, "s \"acme.default\"\n") << "nothing was stored";

    // No catalog configured: the check ends at once.
    CommandResult check = busctl("call " + std::string(kDaemonBusName) + " " + kDaemonObjectPath +
                                 " " + kDaemonInterface + " CheckForTavrixBundleUpdate");
    EXPECT_EQ(check.output, "b false\n");
    ASSERT_TRUE(watcher().waitForStatus({{"LastCheckOutcome", "no-catalog"}}));
    EXPECT_EQ(watcher().nextCheckFinished(10s), json({"no-catalog", "no catalog configured"}));

    // The interface XML kept in docs/ is what the daemon introspects as: the same methods with the
    // same arguments, properties and signals, compared by Python's XML parser.
    CommandResult compared = runCommand(
        {"/bin/bash", "-c",
         "set -o pipefail; /usr/bin/busctl --address='" + busAddress() +
             "' introspect --xml-interface com.zandor.tavrixservicesd /com/zandor/tavrixservicesd "
             "| /usr/bin/python3 -c '" +
             R"(import sys, xml.etree.ElementTree as tree
def members(root):
    found = {}
    for interface in root.iter("interface"):
        if not interface.get("name").startswith("com.zandor."):
            continue
        def types(element, direction):
            return "".join(a.get("type") for a in element if a.tag == "arg" and
                           a.get("direction", direction) == direction)
        found[interface.get("name")] = sorted(
            (e.tag, e.get("name"), types(e, "in"), types(e, "out")) if e.tag == "method" else
            (e.tag, e.get("name"), types(e, "out"), "") if e.tag == "signal" else
            (e.tag, e.get("name"), e.get("type"), e.get("access"))
            for e in interface if e.tag in ("method", "signal", "property"))
    return found
documented = members(tree.parse(sys.argv[1]).getroot())
live = members(tree.fromstring(sys.stdin.read()))
print("same" if documented == live else "documented %s\nlive %s" % (documented, live)))" +
             "' '" + TAVRIX_INTERFACE_XML + "'"});
    EXPECT_EQ(compared.status, 0) << compared.output;
    EXPECT_EQ(compared.output, "same\n");
}

// tavrixctl as scripts use it: exit statuses, and its one JSON form read by Python's json module,
// where a date, data, an integer, a real and the same digits as text all stay apart.
TEST_F(StatusPropertiesTest, ScriptsGetExitStatusesAndTypedJson) {
    ASSERT_TRUE(client().setTavrixID("acme.default", pack(writeVersionedBundle("1"))));
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

    // A refused ID (here one too long) fails the command; "no" is printed all the same.
    CommandResult refused = tavrixctl({"set-id", std::string(1025, 'x')});
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(refused.output, "no\n");

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
