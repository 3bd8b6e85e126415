#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>

#include <atomic>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "PrivateBus.h"
#include "client/TavrixClient.h"

namespace tavrix::client {
namespace {

using namespace std::chrono_literals;
using bus::BusPtr;
using testing::HasSubstr;

// Stands in for the daemon under its bus name, on a thread of its own, with answers chosen to
// exercise the client: right ones, error replies and replies of the wrong shape.
class StubService {
  public:
    explicit StubService(const test::PrivateBus& daemon) : bus_(daemon.connect()) {
        if (sd_bus_request_name(bus_.get(), kServiceName, 0) < 0) {
            throw std::runtime_error("cannot own the service name");
        }
        thread_ = std::thread([this] { serve(); });
    }
    ~StubService() {
        stop_ = true;
        thread_.join();
    }
    StubService(const StubService&) = delete;
    StubService& operator=(const StubService&) = delete;

    // Posts a notification as the daemon does, with a body of the given signature.
    template <typename... Arguments>
    void post(const char* signature, Arguments... arguments) {
        std::lock_guard lock(mutex_);
        sd_bus_emit_signal(bus_.get(), kObjectPath, kNotificationInterface, kNotificationMember,
                           signature, arguments...);
        sd_bus_flush(bus_.get());
    }

  private:
    void serve() {
        while (!stop_) {
            std::unique_lock lock(mutex_);
            sd_bus_message* raw = nullptr;
            int r = sd_bus_process(bus_.get(), &raw);
            bus::BusMessagePtr call(raw);
            if (call && sd_bus_message_is_method_call(call.get(), kServerInterface, nullptr)) {
                answer(call.get());
            }
            lock.unlock();
            if (r == 0) {
                sd_bus_wait(bus_.get(), 20'000);
            } else if (r < 0) {
                return;
            }
        }
    }

    void answer(sd_bus_message* call) {
        const std::string member = sd_bus_message_get_member(call);
        if (member == "IsTavrixBundleSupported") {
            sd_bus_reply_method_errorf(call, SD_BUS_ERROR_ACCESS_DENIED, "Not for you");
        } else if (member == "CopyTavrixValue") {
            // Two values where an optional has at most one.
            sd_bus_reply_method_return(call, "av", 2, "s", "a", "s", "b");
        } else if (member == "CheckForTavrixBundleUpdate") {
            sd_bus_reply_method_return(call, "s", "not a boolean");
        } else if (member == "SetClientType") {
            // Known is the caller that sent type 7, the only one the tests expect.
            std::int32_t type = 0;
            sd_bus_message_read_basic(call, 'i', &type);
            sd_bus_reply_method_return(call, "b", type == 7);
        }
    }

    BusPtr bus_;
    std::mutex mutex_;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

// The error operation throws.
ClientError failureOf(const std::function<void()>& operation) {
    try {
        operation();
    } catch (const ClientError& error) {
        return error;
    }
    return ClientError("(no error)");
}

TEST(TavrixClient, ConnectingWhereNothingListensNamesTheProblem) {
    test::PrivateBus bus;
    EXPECT_THAT(failureOf([&] { TavrixClient::connectToAddress(bus.deadAddress()); }).what(),
                HasSubstr("cannot connect to " + bus.deadAddress() + ": No such file"));
    // The system bus is the one the variable names; what main set there is put back.
    const std::string nowhere = ::getenv("DBUS_SYSTEM_BUS_ADDRESS");
    ::setenv("DBUS_SYSTEM_BUS_ADDRESS", bus.deadAddress().c_str(), 1);
    EXPECT_THAT(failureOf([] { TavrixClient::connectToSystemBus(); }).what(),
                HasSubstr("cannot connect to the system bus: No such file"));
    ::setenv("DBUS_SYSTEM_BUS_ADDRESS", bus.address().c_str(), 1);
    EXPECT_NO_THROW(TavrixClient::connectToSystemBus());
    ::setenv("DBUS_SYSTEM_BUS_ADDRESS", nowhere.c_str(), 1);
}

// A client of the stub on a bus of its own.
class ClientOfStub : public testing::Test {
  protected:
    test::PrivateBus bus;
    StubService stub{bus};
    TavrixClient client = TavrixClient::connectToAddress(bus.address());
};

TEST_F(ClientOfStub, DecodesRepliesAndRefusesMalformedOnes) {
    EXPECT_TRUE(client.setClientType(7));
    EXPECT_FALSE(client.setClientType(-7));

    // An error reply (a missing daemon, a refusal) is named with the bus's words; a program
    // switches on the category, not the text.
    ClientError refused = failureOf([&] { client.isTavrixBundleSupported(); });
    EXPECT_STREQ(refused.what(),
                 "IsTavrixBundleSupported failed: org.freedesktop.DBus.Error.AccessDenied: Not for "
                 "you");
    EXPECT_EQ(refused.category(), ErrorCategory::AccessDenied);
    EXPECT_EQ(refused.errorName(), "org.freedesktop.DBus.Error.AccessDenied");
    ClientError malformed = failureOf([&] { client.checkForTavrixBundleUpdate(); });
    EXPECT_STREQ(malformed.what(),
                 "CheckForTavrixBundleUpdate failed: malformed reply: signature \"s\", expected "
                 "\"b\"");
    EXPECT_EQ(malformed.category(), ErrorCategory::MalformedReply);
    EXPECT_EQ(malformed.errorName(), "");
    EXPECT_THAT(failureOf([&] { client.copyTavrixValue("key"); }).what(),
                HasSubstr("CopyTavrixValue failed: malformed reply"));
    // Refused before sending: the bus would carry the text only up to the NUL.
    EXPECT_STREQ(failureOf([&] { client.copyTavrixValue(std::string("k\0ey", 4)); }).what(),
                 "CopyTavrixValue failed: key contains a NUL character");
    // The connection is still good after all of that.
    EXPECT_TRUE(client.setClientType(7));
}

// The asynchronous forms give the same answers and errors, delivered from an application's own
// poll loop over fd(), events() and timeout(); a call dropped before its reply never calls back.
TEST_F(ClientOfStub, AsyncCallsAnswerThroughTheApplicationsOwnLoop) {
    std::optional<AsyncResult<bool>> known;
    std::optional<AsyncResult<bool>> refused;
    bool droppedRan = false;
    PendingCall first = client.setClientTypeAsync(7, [&](AsyncResult<bool> r) { known = r; });
    PendingCall second =
        client.isTavrixBundleSupportedAsync([&](AsyncResult<bool> r) { refused = r; });
    client.setClientTypeAsync(7, [&](AsyncResult<bool>) { droppedRan = true; });
    ASSERT_TRUE(test::pollUntil(
        [&] { return known && refused; }, 30s,
        [&](auto) {
            pollfd ready{client.fd(), client.events(), 0};
            const auto timeout = client.timeout();
            ::poll(&ready, 1, timeout ? static_cast<int>(timeout->count() / 1000) + 1 : 1000);
            client.process();
            return true;
        }));
    EXPECT_EQ(known->value, std::optional<bool>(true));
    ASSERT_TRUE(refused->error);
    EXPECT_FALSE(refused->value);
    EXPECT_EQ(refused->error->category(), ErrorCategory::AccessDenied);
    EXPECT_EQ(refused->error->errorName(), "org.freedesktop.DBus.Error.AccessDenied");
    EXPECT_TRUE(client.setClientType(7));  // answered after the dropped call's reply, if any
    client.process();
    EXPECT_FALSE(droppedRan);
}

TEST_F(ClientOfStub, DeliversNotificationsWhileSubscribedAndHandlerExceptions) {
    std::vector<std::string> names;
    auto subscription = client.subscribe([&](const std::string& name) { names.push_back(name); });

    // The same signal from a peer that does not own the daemon's name is nobody's notification.
    BusPtr lookAlike = bus.connect();
    sd_bus_emit_signal(lookAlike.get(), kObjectPath, kNotificationInterface, kNotificationMember,
                       "s", "LookAlike");
    sd_bus_flush(lookAlike.get());
    stub.post("s", "TXDaemonStartedNotification");
    stub.post("i", 42);  // a matching signal without a name is skipped
    stub.post("s", "kTVXBehaviorBundleChangedNotification");
    EXPECT_TRUE(client.runUntil([&] { return names.size() >= 2; }, 10s));
    client.processFor(200ms);  // time for a straggler
    EXPECT_EQ(names, (std::vector<std::string>{"TXDaemonStartedNotification",
                                               "kTVXBehaviorBundleChangedNotification"}));

    subscription.reset();
    stub.post("s", "TXDaemonStartedNotification");
    EXPECT_FALSE(client.processFor(200ms));
    EXPECT_EQ(names.size(), 2u);

    // What a handler throws comes out of the processing that called it.
    struct HandlerBroke {};
    subscription = client.subscribe([](const std::string&) { throw HandlerBroke{}; });
    stub.post("s", "TXDaemonStartedNotification");
    EXPECT_THROW(client.runUntil([] { return false; }, 10s), HandlerBroke);
}

TEST(TavrixClient, ReportsALostBus) {
    test::PrivateBus bus;
    TavrixClient client = TavrixClient::connectToAddress(bus.address());
    std::optional<NotificationSubscription> subscription =
        client.subscribe([](const std::string&) {});
    bus.stop();
    EXPECT_THAT(failureOf([&] { client.processFor(5s); }).what(),
                HasSubstr("connection to the bus lost"));
    EXPECT_THAT(failureOf([&] { client.setClientType(1); }).what(),
                HasSubstr("SetClientType failed: "));
    // A subscription may outlive its client.
    { TavrixClient gone = std::move(client); }
    subscription.reset();
}

}  // namespace
}  // namespace tavrix::client
