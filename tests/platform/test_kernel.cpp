#include <gtest/gtest.h>

#include <atomic>

#include "platform/kernel.h"
#include "platform/net.h"

namespace {

using platform::WaitResult;

TEST(Event, AutoResetWakesOneWaitManualResetStaysSignalledAndWaitsTimeOut) {
    platform::Event e;
    ASSERT_TRUE(e.IsValid());
    e.Set();
    e.Set();  // setting twice still gives one wake
    EXPECT_EQ(e.Wait(0), WaitResult::Signaled);
    const uint64_t start = platform::GetTickCount64();
    EXPECT_EQ(e.Wait(120), WaitResult::Timeout);
    const uint64_t spent = platform::GetTickCount64() - start;
    EXPECT_GE(spent, 115u);
    EXPECT_LT(spent, 1000u);
    platform::Event manual(true, true);
    EXPECT_EQ(manual.Wait(0), WaitResult::Signaled);
    EXPECT_EQ(manual.Wait(0), WaitResult::Signaled);
    manual.Reset();
    EXPECT_EQ(manual.Wait(0), WaitResult::Timeout);
}

TEST(Thread, StopInterruptsEveryKindOfWaitPromptly) {
    // Each wait would last a minute; Stop must end all of them at once.
    for (int kind = 0; kind < 3; ++kind) {
        std::atomic<int> result{-1};
        platform::Thread t;
        ASSERT_TRUE(t.Start([&] {
            switch (kind) {
                case 0:
                    result = static_cast<int>(platform::Sleep(60000));
                    break;
                case 1: {
                    platform::Event e;
                    result = static_cast<int>(e.Wait(60000));
                    break;
                }
                default: {
                    const auto s = platform::OpenUdpSocket();
                    platform::BindSocket(s.Get(), 0x7F000001, 0);
                    const int r = platform::WaitSocketReadable(s.Get(), 60000);
                    result = r == platform::kSocketError &&
                                     platform::LastSocketError() == platform::kErrInterrupted
                                 ? static_cast<int>(WaitResult::Stopped)
                                 : r;
                }
            }
        }));
        platform::Sleep(50);
        const uint64_t start = platform::GetTickCount64();
        t.Stop();
        EXPECT_LT(platform::GetTickCount64() - start, 500u) << "kind " << kind;
        EXPECT_EQ(result.load(), static_cast<int>(WaitResult::Stopped)) << "kind " << kind;
        EXPECT_TRUE(t.HasFinished());
        EXPECT_FALSE(t.IsStarted());
    }
}

TEST(Thread, StopSourceIsVisibleOnlyInsideTheThread) {
    EXPECT_EQ(platform::CurrentStopSource(), nullptr);
    EXPECT_FALSE(platform::CurrentThreadStopRequested());
    std::atomic<bool> sawSource{false};
    std::atomic<bool> sawRequest{false};
    platform::Thread t;
    ASSERT_TRUE(t.Start([&] {
        sawSource = platform::CurrentStopSource() != nullptr;
        platform::Sleep(60000);
        sawRequest = platform::CurrentThreadStopRequested();
    }));
    EXPECT_FALSE(t.Start([] {}));  // one thread per object
    t.Stop();
    EXPECT_TRUE(sawSource);
    EXPECT_TRUE(sawRequest);
    // A stopped object can run a new thread.
    std::atomic<bool> ran{false};
    ASSERT_TRUE(t.Start([&] { ran = true; }));
    t.Join();
    EXPECT_TRUE(ran);
}

TEST(ThreadLocalSlot, EachThreadSeesItsOwnValue) {
    platform::ThreadLocalSlot slot;
    int mine = 1;
    slot.Set(&mine);
    void* seenElsewhere = &mine;
    platform::Thread t;
    ASSERT_TRUE(t.Start([&] { seenElsewhere = slot.Get(); }));
    t.Join();
    EXPECT_EQ(seenElsewhere, nullptr);
    EXPECT_EQ(slot.Get(), &mine);
}

}  // namespace
