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
    // No operation takes a double.
    for (const char* member : {"SetTavrixID", "CopyTavrixValue", "SetClientType"}) {
        bus::BusError error;
        sd_bus_message* reply = nullptr;
        EXPECT_LT(sd_bus_call_method(bus.get(), kDaemonBusName, kDaemonObjectPath, kDaemonInterface,
                                     member, error.get(), &reply, "d", 4.2),
                  0)
            << member;
        bus::BusMessagePtr owned(reply);
        EXPECT_STREQ(error.name(), SD_BUS_ERROR_INVALID_ARGS) << member;
    }
    const auto pid = daemonPid();
    ASSERT_TRUE(pid);

    auto caller = client();
    EXPECT_FALSE(caller.isTavrixBundleSupported());
    EXPECT_TRUE(caller.setTavrixID("abc", std::nullopt));
    EXPECT_EQ(daemonPid(), pid);
    // The good call after them was handled, once.
    EXPECT_EQ(countLogLines("Handling Set Tavrix ID with abc"), 1);
}

}  // namespace
}  // namespace tavrix::integration
