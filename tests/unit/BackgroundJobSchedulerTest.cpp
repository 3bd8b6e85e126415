#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <memory>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "bus/BackgroundJobScheduler.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::bus {
namespace {

using namespace std::chrono_literals;

constexpr double kHour = 3600.0;
constexpr double kDay = 86400.0;

plist::Dictionary window(double start, double end) {
    return {{std::string(kJobWindowStartDate), start}, {std::string(kJobWindowEndDate), end}};
}

// Records each fire, and lets a test wait for one.
class FiredJobs {
  public:
    BackgroundJobScheduler::Handler handler() {
        return [this](const std::string& name, const plist::Dictionary* job) {
            std::lock_guard lock(mutex_);
            names_.push_back(name);
            threads_.insert(std::this_thread::get_id());
            lastJob_ = job != nullptr ? *job : plist::Dictionary{};
            fired_.notify_all();
        };
    }
    bool waitFor(const std::string& name) {
        std::unique_lock lock(mutex_);
        return fired_.wait_for(lock, 20s, [&] {
            return std::find(names_.begin(), names_.end(), name) != names_.end();
        });
    }
    std::vector<std::string> names() {
        std::lock_guard lock(mutex_);
        return names_;
    }
    std::set<std::thread::id> threads() {
        std::lock_guard lock(mutex_);
        return threads_;
    }
    plist::Dictionary lastJob() {
        std::lock_guard lock(mutex_);
        return lastJob_;
    }

  private:
    std::mutex mutex_;
    std::condition_variable fired_;
    std::vector<std::string> names_;
    std::set<std::thread::id> threads_;
    plist::Dictionary lastJob_;
};

class BackgroundJobSchedulerTest : public testing::Test {
  protected:
    std::unique_ptr<BackgroundJobScheduler> launch(const std::string& client = "com.example.a") {
        return std::make_unique<BackgroundJobScheduler>(client, queue_, fired_.handler());
    }
    static std::string jobsFile() { return BackgroundJobScheduler::jobsFilePath("com.example.a"); }

    // Declared before the queue, which may still run the handler while it goes.
    FiredJobs fired_;
    SerialQueue queue_{"jobs-test"};
};

TEST_F(BackgroundJobSchedulerTest, JobsOutliveTheBindingPerClient) {
    const double start = Clock::absoluteTimeNow() + kHour;
    plist::Dictionary criteria = window(start, start + kHour);
    criteria.emplace(std::string(kJobPowerOptimizationLevel), plist::Integer(1));
    launch()->addJob("kept", criteria);
    launch()->addJob("removed", criteria);
    launch()->removeJob("removed");

    EXPECT_EQ(launch()->copyJobs(), (plist::Dictionary{{"kept", criteria}}));
    EXPECT_TRUE(launch("com.example.b")->copyJobs().empty());
    struct stat info {};
    ASSERT_EQ(::stat(jobsFile().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
}

TEST_F(BackgroundJobSchedulerTest, DamagedFilesReadAsNoJobsAndBadEntriesAreSkipped) {
    const double start = Clock::absoluteTimeNow() + kHour;
    for (const std::string& damaged :
         {std::string("not a property list\0\x01", 22), plist::serialize(plist::Array{1, 2})}) {
        test::writeText(jobsFile(), damaged);
        auto binding = launch();
        EXPECT_TRUE(binding->copyJobs().empty());
        // The next change replaces the damaged file with a good one.
        ASSERT_TRUE(binding->addJob("new", window(start, start + kHour)));
        auto rewritten = plist::readFile(jobsFile());
        EXPECT_TRUE(rewritten && rewritten->find("new") != nullptr);
    }

    plist::Dictionary reversed = window(start + kHour, start);
    plist::Dictionary mixed{{"good", window(start, start + kHour)},
                            {"not a dictionary", "job"},
                            {"reversed", reversed},
                            {"text start", window(start, start + kHour)}};
    mixed.at("text start").asDictionary()->insert_or_assign(std::string(kJobWindowStartDate), "x");
    ASSERT_TRUE(plist::writeFile(jobsFile(), plist::Value(mixed)));
    EXPECT_EQ(launch()->copyJobs().size(), 1u);
    EXPECT_FALSE(launch()->addJob("reversed", reversed));

    // A file that cannot be replaced: the job still fires from memory.
    std::filesystem::remove(jobsFile());
    std::filesystem::create_directories(jobsFile());
    auto unwritable = launch();
    EXPECT_TRUE(unwritable->addJob("in memory", window(start - kHour, start)));
    EXPECT_TRUE(fired_.waitFor("in memory"));
}

// Each job fires once, on the queue, with its criteria, in the order of the windows; a removed or
// re-added job does not fire for its old window.
TEST_F(BackgroundJobSchedulerTest, FiresOnceOnTheQueueWhenTheWindowStartsUnlessCancelled) {
    auto binding = launch();
    const double start = Clock::absoluteTimeNow();
    plist::Dictionary first = window(start + 0.2, start + kHour);
    first.emplace(std::string(kJobAllowedDuringVoiceCall), true);
    binding->addJob("first", first);
    binding->addJob("removed", window(start + 0.3, start + kHour));
    binding->addJob("moved", window(start + 0.3, start + kHour));
    binding->addJob("last", window(start + 0.5, start + kHour));
    binding->removeJob("removed");
    binding->addJob("moved", window(start + kDay, start + kDay + kHour));

    ASSERT_TRUE(fired_.waitFor("last"));
    EXPECT_EQ(fired_.names(), (std::vector<std::string>{"first", "last"}));
    std::thread::id queueThread;
    queue_.dispatchSync([&] { queueThread = std::this_thread::get_id(); });
    EXPECT_EQ(fired_.threads(), std::set<std::thread::id>{queueThread});
    auto stored = plist::readFile(jobsFile());
    ASSERT_TRUE(stored && stored->isDictionary());
    EXPECT_EQ(stored->asDictionary()->size(), 1u);
    EXPECT_NE(stored->find("moved"), nullptr);

    // A window that contains now fires at once.
    binding->addJob("now", first);
    ASSERT_TRUE(fired_.waitFor("now"));
    EXPECT_EQ(fired_.lastJob(), first);
}

// Relaunched a day later, a job whose window contains the launch is queued before the binding is
// back, and one whose window passed is dropped; moving the clock on wakes the running timer.
TEST_F(BackgroundJobSchedulerTest, RelaunchFiresDueJobsDropsPassedOnesAndFollowsTheClock) {
    const double start = Clock::absoluteTimeNow();
    {
        auto binding = launch();
        binding->addJob("due", window(start + kDay, start + kDay + kHour));
        binding->addJob("missed", window(start + kHour, start + 2 * kHour));
        binding->addJob("later", window(start + 15 * kDay, start + 15 * kDay + kHour));
    }
    ScopedClockOffset dayLater(std::chrono::seconds(86400 + 60));
    auto relaunched = launch();
    queue_.dispatchSync([] {});
    EXPECT_EQ(fired_.names(), std::vector<std::string>{"due"});
    EXPECT_FALSE(relaunched->addJob("past", window(start, start + kHour)));
    EXPECT_EQ(relaunched->copyJobs().size(), 1u);

    ScopedClockOffset fortnightLater(std::chrono::seconds(15 * 86400 + 60));
    EXPECT_TRUE(fired_.waitFor("later"));
}

}  // namespace
}  // namespace tavrix::bus
