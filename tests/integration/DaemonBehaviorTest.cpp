// The behavior façade as clients see it through the bus: who may set an ID, how it is stored,
// what decides support, and where behavior settings come from.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <sstream>

#include "BusFixture.h"
#include "TestSupport.h"
#include "io/UniqueFd.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;
using DaemonBehaviorTest = BusFixture;
using ::testing::HasSubstr;
using ::testing::Not;

// An ID longer than the limit, or one that cannot be written, is refused: the client hears NO, and
// the stored ID is what the status view, the next call and the next launch see. EnableSupport
// decides support once an ID is set, and with it the behavior settings.
TEST_F(DaemonBehaviorTest, IdsThatCannotBeStoredAreRefusedAndEnableSupportDecidesSupport) {
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

    // A directory where the lock file goes fails the write, as a full disk would.
    const auto lock = at("/var/mobile/Library/Preferences/.com.zandor.tavrixservices.plist.lock");
    fs::remove(lock);
    test::writeText(lock / "in-the-way", "");
    // Asked with a bundle by descriptor, the caller also hears why nothing was extracted.
    const auto payloadFile = device().base() / "payload";
    test::writeText(payloadFile, "never looked at");
    io::UniqueFd payload(::open(payloadFile.c_str(), O_RDONLY | O_CLOEXEC));
    const client::PayloadResult refused = caller.setTavrixIDWithBundleFile("new", payload.get());
    EXPECT_FALSE(refused.accepted);
    EXPECT_EQ(refused.reason, "not accepted: the behavior ID could not be stored");
    const plist::Value status(caller.status());
    EXPECT_EQ(*status.find("BehaviorID"), plist::Value("abc"));
    EXPECT_TRUE(caller.isTavrixBundleSupported());

    fs::remove_all(lock);
    // An empty bundle is no failure.
    EXPECT_TRUE(caller.setTavrixID(std::string(1024, 'y'), std::vector<std::uint8_t>{}));
    EXPECT_EQ(device().daemonPreference("TavrixID"),
              std::optional<plist::Value>(std::string(1024, 'y')));

    // Behavior settings (any value, as it is in the file) are read exactly while supported.
    // Everything else in place, a cellular radio alone refuses the ID and supports nothing.
    const plist::Value limits(plist::Dictionary{{"daily", 10}, {"since", plist::Date{123456}}});
    device().writeBehaviorSettings({{"Limits", limits}});
    const std::tuple<const char*, std::optional<plist::Value>, bool, bool> cases[] = {
        {"absent", std::nullopt, true, false},
        {"false", plist::Value(false), true, false},
        {"true", plist::Value(true), true, true},
        {"the string NO", plist::Value("NO"), true, true},
        {"the integer 0", plist::Value(0), true, true},
        {"true without an ID", plist::Value(true), false, false},
    };
    for (const auto& [what, enableSupport, withID, supported] : cases) {
        plist::Dictionary preferences;
        if (enableSupport) {
            preferences.emplace("EnableSupport", *enableSupport);
        }
        if (withID) {
            preferences.emplace("TavrixID", "abc");
        }
        device().writeDaemonPreferences(preferences);
        EXPECT_EQ(caller.isTavrixBundleSupported(), supported) << "EnableSupport " << what;
        EXPECT_EQ(caller.copyTavrixValue("Limits"),
                  supported ? std::optional(limits) : std::nullopt)
            << "EnableSupport " << what;
    }

    device().writeDaemonPreferences({{"TavrixID", "abc"}, {"EnableSupport", true}});
    device().writeDeviceInfo(true);
    EXPECT_FALSE(caller.setTavrixID("xyz", std::nullopt));
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>("abc"));
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    EXPECT_FALSE(caller.checkForTavrixBundleUpdate());
}

// The packaged bus policy on a bus that denies by default, as the system bus does. Clients run as
// other users (root only), from copies of tavrixctl and its library that those users can reach.
constexpr uid_t kNobody = 65534;
// Stands in for the "tavrix" group, which the machine running the tests need not have.
constexpr const char* kStandInGroup = "users";

std::string replaceOnce(std::string text, const std::string& from, const std::string& to) {
    auto at = text.find(from);
    if (at == std::string::npos || text.find(from, at + 1) != std::string::npos) {
        throw std::runtime_error("the policy should name " + from + " exactly once");
    }
    return text.replace(at, from.size(), to);
}

class DaemonPolicyTest : public BusFixture {
  protected:
    void SetUp() override {
        if (::geteuid() != 0) {
            GTEST_SKIP() << "running clients as other users needs root";
        }
        const group* standIn = ::getgrnam(kStandInGroup);
        if (standIn == nullptr) {
            GTEST_SKIP() << "no group \"" << kStandInGroup << "\" to stand in for \"tavrix\"";
        }
        standInGid_ = standIn->gr_gid;
        // tavrixctl and the client library in a directory anyone may enter; the library path
        // comes first, so the copy never reaches back into the build tree.
        const fs::path directory = clientCopy_.path();
        fs::permissions(directory, fs::perms::others_read | fs::perms::others_exec,
                        fs::perm_options::add);
        ctl_ = directory / "tavrixctl";
        fs::copy_file(TAVRIX_CTL_PATH, ctl_);
        fs::copy_file(TAVRIX_CLIENT_LIBRARY_PATH, directory / TAVRIX_CLIENT_LIBRARY_NAME);
        if (runCommand(asUser({kNobody, kNobody}, {"/usr/bin/test", "-x", ctl_})).status != 0) {
            GTEST_SKIP() << "nobody cannot reach " << ctl_ << " (is $TMPDIR private?)";
        }
        // The packaged policy, with the daemon's user being whoever runs the tests (the bus starts
        // the daemon as that user) and the stand-in group for "tavrix".
        std::string policy = test::readText(TAVRIX_POLICY_PATH);
        policy = replaceOnce(policy, "user=\"tavrixservicesd\"",
                             std::string("user=\"") + ::getpwuid(::geteuid())->pw_name + "\"");
        policy =
            replaceOnce(policy, "group=\"tavrix\"", std::string("group=\"") + kStandInGroup + "\"");
        policyFile = device().base() / "policy.conf";
        test::writeText(*policyFile, policy);
        BusFixture::SetUp();
    }

    CommandResult tavrixctlAs(gid_t gid, const std::vector<std::string>& arguments) {
        std::vector<std::string> command = {"/usr/bin/env",
                                            "LD_LIBRARY_PATH=" + ctl_.parent_path().string(),
                                            ctl_.string(), "--address", busAddress()};
        command.insert(command.end(), arguments.begin(), arguments.end());
        return runCommand(asUser({kNobody, gid}, command));
    }

    gid_t standInGid_ = 0;
    test::TempDir clientCopy_;
    fs::path ctl_;
};

TEST_F(DaemonPolicyTest, AnyoneMayAskButOnlyPrivilegedCallersMayChange) {
    // busctl on the test's bus with the words of arguments.
    auto busctl = [&](const std::string& arguments) {
        std::istringstream words(arguments);
        std::vector<std::string> argv = {"/usr/bin/busctl", "--address=" + busAddress()};
        argv.insert(argv.end(), std::istream_iterator<std::string>(words), {});
        return argv;
    };
    const auto requestName = busctl(
        "call org.freedesktop.DBus /org/freedesktop/DBus org.freedesktop.DBus RequestName su " +
        std::string(kDaemonBusName) + " 0");

    auto refused = runCommand(asUser({kNobody, kNobody}, requestName));
    EXPECT_NE(refused.status, 0) << refused.output;
    EXPECT_THAT(refused.output, HasSubstr("Access denied"));

    // The daemon's user (here the test's own) gets it: busctl becomes the primary owner (1).
    auto owned = runCommand(requestName);
    EXPECT_EQ(owned.status, 0) << owned.output;
    EXPECT_EQ(owned.output, "u 1\n");

    // A look-alike notification from anyone else never reaches a listener, even one that does
    // not check the sender; the daemon's user, posting after it, gets through.
    auto post = [&](const std::string& name) {
        return busctl("emit /com/zandor/tavrixservicesd com.zandor.NotificationCenter Posted s " +
                      name);
    };
    runCommand(asUser({kNobody, kNobody}, post("kTVXBehaviorBundleChangedNotification")));
    EXPECT_EQ(runCommand(post("PolicyTestMarker")).status, 0);
    EXPECT_TRUE(watcher().waitForNotification("PolicyTestMarker", 1, std::chrono::seconds(10)));
    EXPECT_EQ(watcher().notificationCount("kTVXBehaviorBundleChangedNotification"), 0);

    const gid_t nogroup = kNobody;
    for (const std::vector<std::string>& change :
         {std::vector<std::string>{"set-id", "x"}, {"set-id", "x", "--bundle", "-"}}) {
        auto setID = tavrixctlAs(nogroup, change);
        EXPECT_NE(setID.status, 0) << setID.output;
        EXPECT_THAT(setID.output, HasSubstr("AccessDenied"));
    }
    auto update = tavrixctlAs(nogroup, {"check-update"});
    EXPECT_NE(update.status, 0) << update.output;
    // One line that says who may.
    EXPECT_THAT(update.output, HasSubstr("AccessDenied"));
    EXPECT_THAT(update.output, HasSubstr("root and members of the \"tavrix\" group"));
    EXPECT_EQ(std::count(update.output.begin(), update.output.end(), '\n'), 1) << update.output;

    // Answered (value: there is none, hence 1), not refused.
    for (const std::vector<std::string>& question : {std::vector<std::string>{"supported"},
                                                     {"value", "CarrierName"},
                                                     {"client-type", "1"},
                                                     {"status"},
                                                     {"show", "-p", "BehaviorID"}}) {
        auto answer = tavrixctlAs(nogroup, question);
        EXPECT_EQ(answer.status, question.front() == "value" ? 1 : 0)
            << question.front() << ": " << answer.output;
        EXPECT_THAT(answer.output, Not(HasSubstr("AccessDenied"))) << question.front();
    }
    // Refused calls never reached the daemon.
    EXPECT_EQ(countLogLines("Handling Set Tavrix ID with x"), 0);

    auto asGroup = tavrixctlAs(standInGid_, {"set-id", "y"});
    EXPECT_EQ(asGroup.status, 0) << asGroup.output;
    EXPECT_TRUE(waitForLogLine("Handling Set Tavrix ID with y"));
    // By descriptor too (an empty payload: accepted, not extracted).
    auto withBundle = tavrixctlAs(standInGid_, {"set-id", "w", "--bundle", "-"});
    EXPECT_EQ(withBundle.status, 1) << withBundle.output;
    EXPECT_THAT(withBundle.output, testing::StartsWith("yes\n"));
    EXPECT_TRUE(waitForLogLine("Handling Set Tavrix ID with w"));

    EXPECT_TRUE(client().setTavrixID("z", std::nullopt));
}

}  // namespace
}  // namespace tavrix::integration
