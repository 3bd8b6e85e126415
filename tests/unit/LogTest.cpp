#include <gtest/gtest.h>

#include "platform/SystemLog.h"
#include "plist/Value.h"
#include "util/Log.h"

namespace tavrix {
namespace {

class LogTest : public testing::Test {
  protected:
    platform::CapturingLogSink sink;
    platform::ScopedLogSink guard{sink};

    std::string only() {
        auto messages = sink.messages();
        EXPECT_EQ(messages.size(), 1u);
        return messages.empty() ? std::string() : messages.back();
    }
};

TEST_F(LogTest, ObjectConversionUsesTheDescriptionAndNullForNil) {
    plist::Value id("abc");
    plist::Value set(plist::Array{plist::Value("TXMinimumLaunchTransaction")});
    logObjectFormat("Handling Set Tavrix ID with %@", &id);
    EXPECT_EQ(only(), "Handling Set Tavrix ID with abc");
    sink.clear();
    logObjectFormat("Removed client: %@, count: %u", static_cast<const plist::Value*>(nullptr), 0u);
    EXPECT_EQ(only(), "Removed client: (null), count: 0");
    sink.clear();
    logObjectFormat("transactions: %@", &set);
    EXPECT_EQ(only(), "transactions: (\n    TXMinimumLaunchTransaction\n)");
}

TEST_F(LogTest, ObjectFormatMixesPrintfConversionsInOrder) {
    plist::Value key("k");
    logObjectFormat("%s|%5d|%-3s|%lu|%lld|%.2f|%x|%c|%%|%@|%*d|%.*s|%zu|%p", "a", 42, "b", 7ul,
                    -9ll, 3.14159, 255u, 'z', &key, 4, 1, 2, "xyz", std::size_t{5}, nullptr);
    EXPECT_EQ(only(), "a|   42|b  |7|-9|3.14|ff|z|%|k|   1|xy|5|(nil)");
}

TEST_F(LogTest, MessagesAreKeptExactlyIncludingTrailingNewlines) {
    logCFormat("Behavior ID %s is already sent, redoing bundle match\n", "abc");
    logCFormat("no newline %d", 1);
    logObjectFormat("50%% done");
    logObjectFormat("trailing %");
    EXPECT_EQ(sink.messages(),
              (std::vector<std::string>{"Behavior ID abc is already sent, redoing bundle match\n",
                                        "no newline 1", "50% done", "trailing %"}));
}

TEST_F(LogTest, LongMessagesAreNotCut) {
    std::string longText(5000, 'x');
    logCFormat("%s!", longText.c_str());
    logObjectFormat("%s?", longText.c_str());
    EXPECT_EQ(sink.messages(), (std::vector<std::string>{longText + "!", longText + "?"}));
}

}  // namespace
}  // namespace tavrix
