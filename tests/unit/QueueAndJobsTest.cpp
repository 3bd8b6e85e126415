#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <future>
#include <memory>
#include <mutex>
#include <set>
#include <stdexcept>
#include <thread>
#include <vector>

#include "TestDoubles.h"
#include "TestSupport.h"
#include "bus/BackgroundJobScheduler.h"
#include "plist/PropertyListFormat.h"
#include "util/SerialQueue.h"

namespace tavrix::bus {
namespace {

using namespace std::chrono_literals;

constexpr double kHour = 3600.0;
constexpr double kDay = 86400.0;

plist::Dictionary window(double start, double end) {
    return {{std::string(kJobWindowStartDate), start}, {std::string(kJobWindowEndDate), end}};
}

// Records each fire: the names in order, the threads they ran on and the last job's criteria.
class FiredJobs {
  public:
    BackgroundJobScheduler::Handler handler() {
        return [this](const std::string& name, const plist::Dictionary* job) {
            std::lock_guard lock(mutex_);
            names_.push_back(name);
            threads_.insert(std::this_thread::get_id());
            lastJob_ = job != nullptr ? *job : plist::Dictionary{};
        };
    }
    bool waitFor(const std::string& name) {
        return test::pollUntil([&] { return std::ranges::count(names(), name) > 0; }, 20s);
    }
    std::vector<std::string> names() { return locked(names_); }
    std::set<std::thread::id> threads() { return locked(threads_); }
    plist::Dictionary lastJob() { return locked(lastJob_); }

  private:
    template <typename T>
    T locked(const T& member) {
        std::lock_guard lock(mutex_);
        return member;
    }

    std::mutex mutex_;
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

TEST_F(BackgroundJobSchedulerTest, JobsOutliveTheBindingPerClientUnlessTheFileIsDamaged) {
    const double start = Clock::absoluteTimeNow() + kHour;
    plist::Dictionary criteria = window(start, start + kHour);
    criteria.emplace(std::string(kJobPowerOptimizationLevel), plist::Integer(1));
    launch()->addJob("kept", criteria);
    launch()->addJob("removed", criteria);
    launch()->removeJob("removed");

    EXPECT_EQ(launch()->copyJobs(), (plist::Dictionary{{"kept", criteria}}));
    EXPECT_TRUE(launch("com.example.b")->copyJobs().empty());
    EXPECT_EQ(std::filesystem::status(jobsFile()).permissions(), std::filesystem::perms(0600));

    // Damaged files read as no jobs, and bad entries are skipped.
    for (const std::string& damaged :
         {std::string("not a property list\0\x01", 22), *plist::serialize(plist::Array{1, 2})}) {
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

TEST(SerialQueue, RunsTasksInDispatchOrderFromSeveralProducers) {
    SerialQueue queue("test.fifo");
    std::mutex ticketMutex;
    int nextTicket = 0;
    std::vector<int> ran;  // touched only on the queue
    std::atomic<bool> overlapped{false};
    std::atomic<int> running{0};

    std::vector<std::thread> producers;
    for (int p = 0; p < 4; ++p) {
        producers.emplace_back([&] {
            for (int i = 0; i < 200; ++i) {
                // Ticket and dispatch under one lock: the dispatch order is the ticket order.
                std::lock_guard lock(ticketMutex);
                int ticket = nextTicket++;
                queue.dispatchAsync([&, ticket] {
                    if (running.fetch_add(1) != 0) {
                        overlapped = true;
                    }
                    ran.push_back(ticket);
                    running.fetch_sub(1);
                });
            }
        });
    }
    for (auto& producer : producers) {
        producer.join();
    }
    queue.dispatchSync([] {});
    ASSERT_EQ(ran.size(), 800u);
    for (int i = 0; i < 800; ++i) {
        ASSERT_EQ(ran[static_cast<std::size_t>(i)], i);
    }
    EXPECT_FALSE(overlapped);
}

TEST(SerialQueue, SyncWaitsForEarlierTasksAndRunsInlineOnItsOwnThread) {
    SerialQueue queue("test.sync");
    EXPECT_FALSE(queue.isCurrent());

    std::vector<std::string> steps;
    queue.dispatchAsync([&] {
        std::this_thread::sleep_for(20ms);
        steps.push_back("async");
    });
    bool wasCurrent = false;
    EXPECT_TRUE(queue.dispatchSync([&] {
        steps.push_back("outer");
        wasCurrent = queue.isCurrent();
        // Waiting for the queue from the queue itself must not deadlock.
        EXPECT_TRUE(queue.dispatchSync([&] { steps.push_back("inner"); }));
        steps.push_back("outer done");
    }));
    EXPECT_EQ(steps, (std::vector<std::string>{"async", "outer", "inner", "outer done"}));
    EXPECT_TRUE(wasCurrent);
}

TEST(SerialQueue, ThrowingTaskIsLoggedAndTheQueueGoesOn) {
    CapturingLogSink sink;
    ScopedLogSink guard(sink);
    SerialQueue queue("test.throw");
    queue.dispatchAsync([] { throw std::runtime_error("boom"); });
    queue.dispatchAsync([] { throw 42; });
    EXPECT_TRUE(queue.dispatchSync([] { throw std::logic_error("sync boom"); }));
    bool ran = false;
    queue.dispatchSync([&] { ran = true; });
    EXPECT_TRUE(ran);
    EXPECT_EQ(
        sink.messages(),
        (std::vector<std::string>{"Task on queue test.throw failed with an exception: boom",
                                  "Task on queue test.throw failed with an unknown exception",
                                  "Task on queue test.throw failed with an exception: sync boom"}));
}

TEST(SerialQueue, DestructionRunsQueuedWorkAndRefusesNewWork) {
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    int count = 0;
    bool lateAccepted = true;
    {
        auto queue = std::make_unique<SerialQueue>("test.drain");
        queue->dispatchAsync([released] { released.wait(); });
        for (int i = 0; i < 100; ++i) {
            queue->dispatchAsync([&] { ++count; });
        }
        // A task still queued at destruction tries to add more work.
        queue->dispatchAsync([&, q = queue.get()] { lateAccepted = q->dispatchAsync([] {}); });
        std::thread releaser([&] {
            std::this_thread::sleep_for(20ms);
            release.set_value();
        });
        queue.reset();
        releaser.join();
    }
    EXPECT_FALSE(lateAccepted);
    EXPECT_EQ(count, 100);
}

TEST(SerialQueue, DestructionFromItsOwnTaskDoesNotDeadlock) {
    auto queue = std::make_unique<SerialQueue>("test.self");
    std::promise<void> gate;
    auto later = std::make_shared<std::promise<void>>();
    auto laterRan = later->get_future();
    // Both tasks are queued before the first one destroys the queue.
    queue->dispatchAsync([opened = gate.get_future().share(), &queue] {
        opened.wait();
        queue.reset();
    });
    queue->dispatchAsync([later] { later->set_value(); });
    gate.set_value();
    // The task queued before the destruction still runs, on the detached worker.
    ASSERT_EQ(laterRan.wait_for(5s), std::future_status::ready);
    EXPECT_EQ(queue, nullptr);
}

}  // namespace
}  // namespace tavrix::bus
