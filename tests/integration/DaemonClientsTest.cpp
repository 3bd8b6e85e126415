// Peers of the daemon: accepted on their first call, removed when they leave the bus. (Calls of
// the wrong signature never reach the daemon's code: the bus library refuses them by the table.)
#include <cerrno>
#include <cstdint>

#include "BusFixture.h"

namespace tavrix::integration {
namespace {

using DaemonClientsTest = BusFixture;

TEST_F(DaemonClientsTest, ClientsAreCountedInOnFirstCallAndOutWhenTheyLeave) {
    // Clients have no identifier the platform vouches for: nothing a caller chooses reaches the
    // log.
    const std::string name = "(null)";
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
