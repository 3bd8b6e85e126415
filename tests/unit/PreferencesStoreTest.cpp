#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <functional>
#include <thread>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "UnitTestRoot.h"
#include "device/PreferencesStore.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

namespace fs = std::filesystem;
using device::PreferencesStore;
using plist::Value;

constexpr const char* kUser = "mobile";

std::string preferencesDirectory() {
    return (test::unitTestRoot() / "var/mobile/Library/Preferences").string();
}

std::string domainPath(const std::string& domain) {
    return preferencesDirectory() + "/" + domain + ".plist";
}

// What another process sees: a store with nothing cached, reading the file from disk.
std::optional<Value> readFresh(const std::string& key, const std::string& domain) {
    PreferencesStore fresh;
    return fresh.copyValue(key, domain, kUser);
}

class PreferencesStoreTest : public testing::Test {
  protected:
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
    PreferencesStore store;
};

// Values wait in the store until synchronized into an XML file others may read; values of every
// type survive the file (the property-list round trip shows each type).
TEST_F(PreferencesStoreTest, PendingValuesShadowTheFileUntilSynchronized) {
    const std::string domain = "test.pending";
    store.setValue("a", Value(1), domain, kUser);
    EXPECT_EQ(store.copyValue("a", domain, kUser), Value(1));
    EXPECT_FALSE(fs::exists(domainPath(domain)));
    EXPECT_EQ(readFresh("a", domain), std::nullopt);

    ASSERT_TRUE(store.synchronize(domain, kUser));
    EXPECT_EQ(readFresh("a", domain), Value(1));
    EXPECT_EQ(test::readText(domainPath(domain)).rfind("<?xml", 0), 0u);
    EXPECT_EQ(fs::status(domainPath(domain)).permissions(), fs::perms(0644));
    EXPECT_EQ(fs::status(preferencesDirectory()).permissions(), fs::perms(0755));

    // A pending removal hides the stored value at once and deletes it on synchronize.
    store.setValue("a", std::nullopt, domain, kUser);
    store.setValue("never-stored", std::nullopt, domain, kUser);
    EXPECT_EQ(store.copyValue("a", domain, kUser), std::nullopt);
    EXPECT_EQ(readFresh("a", domain), Value(1));
    ASSERT_TRUE(store.synchronize(domain, kUser));
    EXPECT_EQ(readFresh("a", domain), std::nullopt);
    EXPECT_EQ(plist::readFile(domainPath(domain)), Value(plist::Dictionary{}));
    EXPECT_TRUE(sink.messages().empty());
}

TEST_F(PreferencesStoreTest, DamagedFileReadsEmptyIsLoggedOncePerVersionAndIsRepaired) {
    const std::string domain = "test.damaged";
    const std::string path = domainPath(domain);
    const std::vector<std::pair<std::string, std::string>> damaged = {
        {"not a property list at all", "it is not a complete XML property list"},
        {*plist::serialize(Value(plist::Array{Value("not"), Value("a dictionary")})),
         "it is not a dictionary"},
    };

    for (const auto& [bytes, reason] : damaged) {
        SCOPED_TRACE(testing::PrintToString(bytes));
        const std::string logLine =
            "Property list " + path + " refused: " + reason + "; reading it as empty";
        test::writeText(path, bytes);
        ASSERT_TRUE(store.synchronize(domain, kUser));
        sink.clear();

        EXPECT_EQ(store.copyValue("old", domain, kUser), std::nullopt);
        EXPECT_EQ(store.copyValue("old", domain, kUser), std::nullopt);
        ASSERT_TRUE(store.synchronize(domain, kUser));
        EXPECT_EQ(store.copyValue("old", domain, kUser), std::nullopt);
        EXPECT_EQ(sink.messages(), std::vector<std::string>{logLine});

        // Writing replaces the damaged file with a good one holding only the new value.
        store.setValue("new", Value("repaired"), domain, kUser);
        ASSERT_TRUE(store.synchronize(domain, kUser));
        EXPECT_EQ(plist::readFile(path), Value(plist::Dictionary{{"new", Value("repaired")}}));
        EXPECT_EQ(sink.messages(), std::vector<std::string>{logLine});
    }
    // No temporary file is left behind: the domain and its lock file only.
    EXPECT_EQ(std::distance(fs::directory_iterator(preferencesDirectory()), {}), 2);
}

// Names that could reach outside the Preferences directory, or no file name at all, answer
// nothing and write nothing anywhere.
TEST_F(PreferencesStoreTest, InvalidDomainsAndUsersAnswerNothing) {
    const std::vector<std::pair<std::string, std::string>> names = {
        {"", kUser},
        {".", kUser},
        {"..", kUser},
        {"a/b", kUser},
        {std::string("a\0b", 3), kUser},
        {std::string(300, 'x'), kUser},
        {"test.users", "nobody-here"},
    };
    for (const auto& [domain, user] : names) {
        SCOPED_TRACE(domain + " " + user);
        store.setValue("k", Value(1), domain, user);
        EXPECT_EQ(store.copyValue("k", domain, user), std::nullopt);
        EXPECT_FALSE(store.synchronize(domain, user));
    }
    EXPECT_FALSE(fs::exists(preferencesDirectory()));
}

// A write that cannot be made fails, keeps the pending value and succeeds once repaired.
TEST_F(PreferencesStoreTest, FailedWritesKeepThePendingValues) {
    const std::string domain = "test.failing";
    const std::string directory = preferencesDirectory();
    const std::string path = domainPath(domain);
    const std::vector<std::pair<std::function<void()>, std::function<void()>>> cases = {
        {[&] { test::writeText(directory, "a file, not a directory"); },
         [&] { fs::remove(directory); }},
        // Anyone could rename the file the daemon writes in a directory like this one.
        {[&] {
             fs::create_directories(directory);
             fs::permissions(directory, fs::perms::all);
         },
         [&] {
             fs::permissions(directory, fs::perms::group_write | fs::perms::others_write,
                             fs::perm_options::remove);
         }},
    };
    for (std::size_t i = 0; i < cases.size(); ++i) {
        SCOPED_TRACE(i);
        std::string key = "k" + std::to_string(i);
        cases[i].first();
        store.setValue(key, Value("kept"), domain, kUser);
        EXPECT_FALSE(store.synchronize(domain, kUser));
        // Why the directory is refused, and that the write failed.
        EXPECT_EQ(sink.messages().size(), 2u);
        EXPECT_EQ(store.copyValue(key, domain, kUser), Value("kept"));
        sink.clear();

        cases[i].second();
        EXPECT_TRUE(store.synchronize(domain, kUser));
        EXPECT_EQ(readFresh(key, domain), Value("kept"));
        fs::remove(path);
    }
}

// The store never writes a file its reader would refuse, nor rewrites one it could not read: the
// values it holds would be lost to the next reader.
TEST_F(PreferencesStoreTest, NeverWritesWhatItsReaderRefusesNorOverWhatItCouldNotRead) {
    const std::string domain = "test.limits";
    const std::string huge(plist::kMaxPropertyListBytes + 1, 'x');
    store.setValue("k", Value("small"), domain, kUser);
    ASSERT_TRUE(store.synchronize(domain, kUser));
    EXPECT_FALSE(store.storeValue("big", Value(huge), domain, kUser));
    EXPECT_EQ(readFresh("k", domain), Value("small"));
    EXPECT_EQ(store.copyValue("big", domain, kUser), std::nullopt);

    test::writeText(domainPath(domain), huge);
    EXPECT_FALSE(store.storeValue("k", Value("other"), domain, kUser));
    EXPECT_EQ(fs::file_size(domainPath(domain)), huge.size());
}

// Writers in two processes, each with two threads sharing one store, add keys of their own to one
// domain; none may be lost.
TEST_F(PreferencesStoreTest, ConcurrentWritersLoseNoUpdate) {
    const std::string domain = "test.concurrent";
    constexpr int kWrites = 40;
    auto writer = [&](const std::string& prefix) {
        return [=] {
            PreferencesStore shared;
            std::atomic<bool> ok{true};
            auto write = [&](const std::string& thread) {
                for (int i = 0; i < kWrites; ++i) {
                    std::string key = prefix + thread + std::to_string(i);
                    shared.setValue(key, Value(i), domain, kUser);
                    ok = ok && shared.synchronize(domain, kUser) &&
                         shared.copyValue(key, domain, kUser) == Value(i);
                }
            };
            std::thread first(write, "x");
            std::thread second(write, "y");
            first.join();
            second.join();
            return ok.load();
        };
    };
    // Each child exits 0 when its writers saw every value they wrote.
    std::vector<pid_t> children;
    for (const char* prefix : {"a", "b"}) {
        if (pid_t pid = ::fork(); pid == 0) {
            ::_exit(writer(prefix)() ? 0 : 1);
        } else {
            children.push_back(pid);
        }
    }
    for (pid_t child : children) {
        int status = -1;
        EXPECT_EQ(::waitpid(child, &status, 0), child);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }

    auto stored = plist::readFile(domainPath(domain));
    ASSERT_TRUE(stored && stored->isDictionary());
    EXPECT_EQ(stored->asDictionary()->size(), 4u * kWrites);
}

}  // namespace
}  // namespace tavrix
