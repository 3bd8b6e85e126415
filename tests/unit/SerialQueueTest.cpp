#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <vector>

#include "util/SerialQueue.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

using namespace std::chrono_literals;

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

// The daemon's bounded stop: a worker still busy when patience runs out is left running, new
// work is refused meanwhile, and a later stop joins it once it is done.
TEST(SerialQueue, ShutdownWithPatienceGivesUpOnABusyWorkerThenJoinsItLater) {
    SerialQueue queue("test.patience");
    std::promise<void> release;
    std::atomic<bool> finished{false};
    queue.dispatchAsync([released = release.get_future().share(), &finished] {
        released.wait();
        finished = true;
    });
    EXPECT_FALSE(queue.shutdown(20ms));
    EXPECT_FALSE(queue.dispatchAsync([] {}));
    release.set_value();
    EXPECT_TRUE(queue.shutdown(5s));
    EXPECT_TRUE(finished);
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
}  // namespace tavrix
