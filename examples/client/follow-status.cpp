// Follows the daemon's status from an application's sd-event loop: prints every status property
// once, then each change the daemon announces, until interrupted or after --count changes.
// Build: c++ -std=c++20 follow-status.cpp $(pkg-config --cflags --libs tavrixclient libsystemd)
#include <signal.h>
#include <systemd/sd-event.h>
#include <tavrix/client/TavrixClient.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace {

using tavrix::client::AsyncResult;
using tavrix::client::TavrixClient;
using tavrix::plist::Dictionary;
using tavrix::plist::Value;

// Text as it is, booleans as yes or no, times (microseconds since 1970) as numbers.
std::string text(const Value& value) {
    if (const std::string* string = value.asString()) {
        return *string;
    }
    if (const bool* flag = value.asBoolean()) {
        return *flag ? "yes" : "no";
    }
    return value.description();
}

}  // namespace

int main(int argc, char** argv) {
    std::string address;
    long count = -1;  // follow until interrupted
    for (int i = 1; i < argc; ++i) {
        const std::string argument = argv[i];
        if (argument == "--address" && i + 1 < argc) {
            address = argv[++i];
        } else if (argument == "--count" && i + 1 < argc) {
            count = std::strtol(argv[++i], nullptr, 10);
        } else {
            std::printf("usage: follow-status [--address D-BUS-ADDRESS] [--count N]\n");
            return argument == "--help" || argument == "-h" ? 0 : 2;
        }
    }

    sd_event* event = nullptr;
    if (sd_event_default(&event) < 0) {
        std::fprintf(stderr, "follow-status: no event loop\n");
        return 1;
    }
    // SIGINT and SIGTERM end the loop (a source without a handler exits it).
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGINT);
    sigaddset(&stop, SIGTERM);
    sigprocmask(SIG_BLOCK, &stop, nullptr);
    sd_event_add_signal(event, nullptr, SIGINT, nullptr, nullptr);
    sd_event_add_signal(event, nullptr, SIGTERM, nullptr, nullptr);

    int status = 0;
    try {
        TavrixClient client = address.empty() ? TavrixClient::connectToSystemBus()
                                              : TavrixClient::connectToAddress(address);
        client.attach(event);
        long changes = 0;
        // Subscribed before reading, so that no change falls between the two.
        auto subscription = client.subscribePropertiesChanged([&](const Dictionary& changed) {
            for (const auto& [name, value] : changed) {
                std::printf("changed: %s=%s\n", name.c_str(), text(value).c_str());
            }
            std::fflush(stdout);
            if (count >= 0 && ++changes >= count) {
                sd_event_exit(event, 0);
            }
        });
        auto pending = client.propertiesAsync([&](AsyncResult<Dictionary> properties) {
            if (!properties) {
                std::fprintf(stderr, "follow-status: %s\n", properties.error->what());
                sd_event_exit(event, 1);
                return;
            }
            for (const auto& [name, value] : *properties.value) {
                std::printf("%s=%s\n", name.c_str(), text(value).c_str());
            }
            std::printf("following\n");
            std::fflush(stdout);
            if (count == 0) {
                sd_event_exit(event, 0);
            }
        });
        status = sd_event_loop(event) == 0 ? 0 : 1;
    } catch (const tavrix::client::ClientError& error) {
        std::fprintf(stderr, "follow-status: %s\n", error.what());
        status = 1;
    }
    sd_event_unref(event);
    return status;
}
