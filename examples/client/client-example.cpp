// A first program against the client library: connect, ask whether behavior bundles are
// supported, read one behavior setting, and wait for one notification from the daemon.
// Build: c++ -std=c++20 client-example.cpp $(pkg-config --cflags --libs tavrixclient)
#include <tavrix/client/TavrixClient.h>

#include <chrono>
#include <cstdio>
#include <optional>
#include <string>

int main(int argc, char** argv) {
    std::string address;
    std::string key = "CarrierName";
    for (int i = 1; i < argc; ++i) {
        const std::string argument = argv[i];
        if (argument == "--help" || argument == "-h") {
            std::printf("usage: client-example [--address D-BUS-ADDRESS] [KEY]\n");
            return 0;
        }
        if (argument == "--address" && i + 1 < argc) {
            address = argv[++i];
        } else {
            key = argument;
        }
    }
    try {
        using tavrix::client::TavrixClient;
        TavrixClient client = address.empty() ? TavrixClient::connectToSystemBus()
                                              : TavrixClient::connectToAddress(address);
        // Subscribed first: the call below may start the daemon, which announces itself.
        std::string heard;
        auto subscription = client.subscribe([&](const std::string& name) { heard = name; });

        std::printf("supported: %s\n", client.isTavrixBundleSupported() ? "yes" : "no");
        std::optional<tavrix::plist::Value> value = client.copyTavrixValue(key);
        std::printf("%s: %s\n", key.c_str(), value ? value->description().c_str() : "(none)");

        if (client.runUntil([&] { return !heard.empty(); }, std::chrono::seconds(15))) {
            std::printf("notification: %s\n", heard.c_str());
        } else {
            std::printf("no notification within 15 s\n");
        }
    } catch (const tavrix::client::ClientError& error) {
        std::fprintf(stderr, "client-example: %s\n", error.what());
        return 1;
    }
    return 0;
}
