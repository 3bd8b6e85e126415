// The behavior façade as clients see it through the bus: who may set an ID, how it is stored,
// what decides support, and where behavior settings come from.
#include "BusFixture.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

using DaemonBehaviorTest = BusFixture;

// Everything else in place, a cellular radio alone refuses the ID and supports nothing.
TEST_F(DaemonBehaviorTest, CellularDeviceRefusesTheIdAndSupportsNothing) {
    device().setCellularRadio(true);
    device().writeDaemonPreferences({{"TavrixID", "abc"}, {"EnableSupport", true}});
    auto caller = client();

    EXPECT_FALSE(caller.setTavrixID("xyz", std::nullopt));
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>("abc"));
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    EXPECT_FALSE(caller.checkForTavrixBundleUpdate());
}

// Setting the ID checks only the radio: without "EnableSupport" it is still stored, lower-cased
// (every letter with a lower-case form, not only ASCII ones), and an empty bundle is no failure.
TEST_F(DaemonBehaviorTest, IdIsStoredLowerCasedWhetherOrNotSupportIsEnabled) {
    const std::string id =
        "\xC3\x89"
        "COLE-\xC3\x84"
        "BC";
    auto caller = client();
    EXPECT_TRUE(caller.setTavrixID(id, std::nullopt));
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>("\xC3\xA9"
                                                                                 "cole-\xC3\xA4"
                                                                                 "bc"));
    EXPECT_TRUE(caller.setTavrixID(id, std::vector<std::uint8_t>{}));
}

// An ID longer than the stored limit, or one that cannot be written (here a directory sits where
// the preferences' lock file goes, as a full disk would fail it), is refused: the client hears NO,
// and the stored ID is what the status view, the next call and the next launch see.
TEST_F(DaemonBehaviorTest, IdsThatCannotBeStoredAreRefusedAndTheStoredOneStays) {
    device().writeDaemonPreferences({{"TavrixID", "abc"}, {"EnableSupport", true}});
    auto caller = client();
    EXPECT_FALSE(caller.setTavrixID(std::string(1025, 'x'), std::nullopt));
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>("abc"));
    // A noncharacter, which the bus allows and its library cannot read: the caller is told why.
    CommandResult noncharacter = runCommand({"/usr/bin/python3", "-c", R"(import dbus, sys
bus = dbus.bus.BusConnection(sys.argv[1])
daemon = bus.get_object("com.zandor.tavrixservicesd", "/com/zandor/tavrixservicesd")
try:
    daemon.SetTavrixID("a\ufffe", dbus.Array([], signature="ay"),
                       dbus_interface="com.zandor.TXManagerServerInterface")
except dbus.DBusException as error:
    print(error.get_dbus_name(), error.get_dbus_message())
)",
                                             busAddress()});
    EXPECT_EQ(noncharacter.output,
              "org.freedesktop.DBus.Error.InvalidArgs The behavior ID is not text this service "
              "can read: invalid UTF-8 or a Unicode noncharacter\n");
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>("abc"));

    const auto lock = at("/var/mobile/Library/Preferences/.com.zandor.tavrixservices.plist.lock");
    std::filesystem::remove(lock);
    test::writeText(lock / "in-the-way", "");
    EXPECT_FALSE(caller.setTavrixID("new", std::nullopt));
    const plist::Value status(caller.status());
    EXPECT_EQ(*status.find("BehaviorID"), plist::Value("abc"));
    EXPECT_TRUE(caller.isTavrixBundleSupported());

    std::filesystem::remove_all(lock);
    EXPECT_TRUE(caller.setTavrixID(std::string(1024, 'y'), std::nullopt));
    EXPECT_EQ(device().daemonPreference("TavrixID"),
              std::optional<plist::Value>(std::string(1024, 'y')));
}

// Behavior settings (any value, as it is in the file) are read exactly while supported.
TEST_F(DaemonBehaviorTest, EnableSupportDecidesSupportOnceAnIdIsSetAndWithItTheSettings) {
    const plist::Value limits(plist::Dictionary{{"daily", 10}, {"since", plist::Date{123456}}});
    device().writeBehaviorSettings({{"Limits", limits}});
    struct Case {
        const char* what;
        std::optional<plist::Value> enableSupport;
        bool withID;
        bool supported;
    };
    const Case cases[] = {
        {"absent", std::nullopt, true, false},
        {"false", plist::Value(false), true, false},
        {"true", plist::Value(true), true, true},
        {"the string NO", plist::Value("NO"), true, true},
        {"the integer 0", plist::Value(0), true, true},
        {"true without an ID", plist::Value(true), false, false},
    };
    auto caller = client();
    // Started first, so that each case's preferences are read by a running daemon.
    ASSERT_TRUE(caller.setClientType(0));
    for (const Case& test : cases) {
        plist::Dictionary preferences;
        if (test.enableSupport) {
            preferences.emplace("EnableSupport", *test.enableSupport);
        }
        if (test.withID) {
            preferences.emplace("TavrixID", "abc");
        }
        device().writeDaemonPreferences(preferences);
        EXPECT_EQ(caller.isTavrixBundleSupported(), test.supported)
            << "EnableSupport " << test.what;
        EXPECT_EQ(caller.copyTavrixValue("Limits"),
                  test.supported ? std::optional(limits) : std::nullopt)
            << "EnableSupport " << test.what;
    }
}

}  // namespace
}  // namespace tavrix::integration
