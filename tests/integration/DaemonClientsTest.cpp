// Peers of the daemon: accepted on their first call, removed when they leave the bus, and a
// malformed call refused without harm.
#include <cstdint>
#include <fstream>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

using DaemonClientsTest = BusFixture;

// The daemon names a client by its command name, which the kernel truncates to 15 bytes.
std::string ownCommandName() {
    std::ifstream in("/proc/self/comm");
    std::string name;
    std::getline(in, name);
    return name;
}

TEST_F(DaemonClientsTest, ClientsAreCountedInOnFirstCallAndOutWhenTheyLeave) {
    const std::string name = ownCommandName();
    std::optional<client::TavrixClient> first(client());
    EXPECT_TRUE(first->setClientType(0));
    EXPECT_TRUE(waitForLogLine("Added client: " + name + ", count: 1"));
    {
        auto second = client();
        EXPECT_TRUE(second.setClientType(-7));
        EXPECT_TRUE(second.setClientType(INT32_MAX));
        EXPECT_TRUE(waitForLogLine("Added client: " + name + ", count: 2"));
    }
    EXPECT_TRUE(waitForLogLine("Removed client: " + name + ", count: 1"));
    first.reset();
    EXPECT_TRUE(waitForLogLine("Removed client: " + name + ", count: 0"));
    // A later call of a known client is not a new acceptance.
    EXPECT_EQ(countLogLines("Added client: " + name + ", count: 3"), 0);
    EXPECT_EQ(countLogLines("*********** Beginning Corvex transaction : TXAddClientTransaction "
                            "***********"),
              2);
}

TEST_F(DaemonClientsTest, WrongSignatureGetsInvalidArgsAndTheDaemonCarriesOn) {
    auto bus = rawConnection();
    struct BadCall {
        const char* member;
        const char* signature;
    };
    for (const BadCall& call : {BadCall{"SetTavrixID", "i"}, BadCall{"CopyTavrixValue", "i"},
                                BadCall{"SetClientType", "s"}}) {
        bus::BusError error;
        sd_bus_message* reply = nullptr;
        int result = 0;
        if (std::string_view(call.signature) == "i") {
            result =
                sd_bus_call_method(bus.get(), kDaemonBusName, kDaemonObjectPath, kDaemonInterface,
                                   call.member, error.get(), &reply, "i", 42);
        } else {
            result =
                sd_bus_call_method(bus.get(), kDaemonBusName, kDaemonObjectPath, kDaemonInterface,
                                   call.member, error.get(), &reply, "s", "42");
        }
        bus::BusMessagePtr owned(reply);
        EXPECT_LT(result, 0) << call.member;
        EXPECT_STREQ(error.name(), SD_BUS_ERROR_INVALID_ARGS) << call.member;
    }
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);

    auto caller = client();
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    EXPECT_TRUE(caller.setTavrixID("abc", std::nullopt));
    EXPECT_EQ(daemonPid(), pid);
    EXPECT_EQ(countLogLines("Handling Set Tavrix ID with abc"), 1);
    EXPECT_EQ(countLogLines("Handling Copy Tavrix Value for key 42"), 0);
}

}  // namespace
}  // namespace tavrix::integration
