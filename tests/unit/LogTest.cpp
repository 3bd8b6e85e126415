#include <gtest/gtest.h>

#include "TestDoubles.h"
#include "plist/Value.h"
#include "util/Log.h"

namespace tavrix {
namespace {

class LogTest : public testing::Test {
  protected:
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

// Objects show their description, nil "(null)", printf conversions mix in order, and a message is
// kept exactly, its trailing line break too; one message stays one line.
TEST_F(LogTest, FormatsAreKeptExactly) {
    plist::Value key("k");
    plist::Value set(plist::Array{plist::Value("TXMinimumLaunchTransaction")});
    logObjectFormat("%s|%5d|%-3s|%lu|%lld|%.2f|%x|%c|%%|%@|%*d|%.*s|%zu|%p", "a", 42, "b", 7ul,
                    -9ll, 3.14159, 255u, 'z', &key, 4, 1, 2, "xyz", std::size_t{5}, nullptr);
    logObjectFormat("Removed client: %@, count: %u", static_cast<const plist::Value*>(nullptr), 0u);
    logObjectFormat("transactions: %@", &set);
    logCFormat("Behavior ID %s is already sent, redoing bundle match\n", "abc");
    logCFormat("no newline %d", 1);
    logObjectFormat("trailing %");
    EXPECT_EQ(sink.messages(),
              (std::vector<std::string>{"a|   42|b  |7|-9|3.14|ff|z|%|k|   1|xy|5|(nil)",
                                        "Removed client: (null), count: 0",
                                        "transactions: (\\n    TXMinimumLaunchTransaction\\n)",
                                        "Behavior ID abc is already sent, redoing bundle match\n",
                                        "no newline 1", "trailing %"}));
}

// A client's text can neither forge a journal entry (a new line with a priority prefix) nor
// flood the log: values are escaped and cut, whichever wrapper shows them.
TEST_F(LogTest, ClientValuesAreEscapedAndCut) {
    std::string forged = "abc\n<0>forged\ttab\x1b[31m\x7f";
    plist::Value key(forged);
    logCFormat("Copying %s\n", forged.c_str());
    logObjectFormat("key: %@", &key);
    const std::string escaped = "abc\\n<0>forged\\ttab\\x1b[31m\\x7f";
    EXPECT_EQ(sink.messages(),
              (std::vector<std::string>{"Copying " + escaped + "\n", "key: " + escaped}));

    sink.clear();
    std::string huge(30 << 20, 'x');
    plist::Value hugeValue(huge);
    logCFormat("%s!", huge.c_str());
    logObjectFormat("%@?", &hugeValue);
    const std::string cut = std::string(2048, 'x') + "...";
    EXPECT_EQ(sink.messages(), (std::vector<std::string>{cut + "!", cut + "?"}));
}

// An operator filters by priority (the caller's) and by the fields of the flow a message belongs
// to; a client's value can raise neither.
TEST_F(LogTest, JournalEntriesCarryPriorityAndScopedFields) {
    logCFormat(LogPriority::Warning, "Failed to establish link from %s to %s\n", "a", "b");
    logCFormat("Copying %s\n", "refused error failed");
    const plist::Value failed("failed");
    logObjectFormat(LogPriority::Warning, "%@", &failed);
    EXPECT_EQ(sink.priorities(), (std::vector<int>{LOG_WARNING, LOG_NOTICE, LOG_WARNING}));

    ScopedLogField outer("TAVRIX_BEHAVIOR_ID", "outer");
    {
        ScopedLogField id("TAVRIX_BEHAVIOR_ID", "abc\ndef");
        ScopedLogField version("TAVRIX_BUNDLE_VERSION", "2.0");
        EXPECT_EQ(
            journalFields(LOG_WARNING, "line one\nline two\n"),
            (std::vector<std::string>{"MESSAGE=line one\nline two", "PRIORITY=4",
                                      "SYSLOG_IDENTIFIER=tavrixservicesd",
                                      "TAVRIX_BUNDLE_VERSION=2.0", "TAVRIX_BEHAVIOR_ID=abc\ndef"}));
    }
    EXPECT_EQ(journalFields(LOG_NOTICE, "x").back(), "TAVRIX_BEHAVIOR_ID=outer");
}

}  // namespace
}  // namespace tavrix
