// Peers of the daemon: accepted on their first call, removed when they leave the bus. (Calls of
// the wrong signature never reach the daemon's code: the bus library refuses them by the table.)
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

}  // namespace
}  // namespace tavrix::integration
