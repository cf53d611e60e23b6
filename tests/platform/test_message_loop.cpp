#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/kernel.h"
#include "platform/message.h"

namespace {

using platform::LPARAM;
using platform::LRESULT;
using platform::UINT;
using platform::WPARAM;

struct Received {
    UINT message;
    WPARAM wParam;
    LPARAM lParam;
    uint32_t threadId;
    uint64_t tick;
};

class RecordingWindow : public platform::MessageWindow {
  public:
    LRESULT WindowProc(UINT message, WPARAM wParam, LPARAM lParam, bool& handled) override {
        received.push_back(
            {message, wParam, lParam, platform::GetCurrentThreadId(), platform::GetTickCount64()});
        if (onMessage) {
            onMessage(message, wParam);
        }
        handled = true;
        return 0;
    }
    size_t Count(UINT message) const {
        size_t n = 0;
        for (const auto& r : received) {
            n += r.message == message ? 1 : 0;
        }
        return n;
    }
    std::vector<Received> received;
    std::function<void(UINT, WPARAM)> onMessage;
};

constexpr UINT kMsg = platform::WM_USER + 123;

// Each test: a window of the test's thread.
class MessageLoop : public ::testing::Test {
  protected:
    void SetUp() override { ASSERT_TRUE(w.CreateMessageWindow()); }
    RecordingWindow w;
};

TEST_F(MessageLoop, PostedMessagesWaitForTheOwnerThenArriveInOrderAndDieWithTheirWindow) {
    std::thread([h = w.Handle()] {
        for (WPARAM i = 0; i < 20; ++i) {
            ASSERT_TRUE(platform::PostMessage(h, kMsg, i, static_cast<LPARAM>(i) * 2));
        }
    }).join();
    EXPECT_TRUE(w.received.empty());
    EXPECT_EQ(platform::PumpPendingMessages(), 20);
    EXPECT_EQ(platform::PumpPendingMessages(), 0);
    ASSERT_EQ(w.received.size(), 20u);
    for (WPARAM i = 0; i < 20; ++i) {
        EXPECT_EQ(w.received[i].wParam, i);
        EXPECT_EQ(w.received[i].lParam, static_cast<LPARAM>(i) * 2);
        EXPECT_EQ(w.received[i].threadId, platform::GetCurrentThreadId());
    }
    auto other = std::make_unique<RecordingWindow>();
    ASSERT_TRUE(other->CreateMessageWindow());
    const auto handle = other->Handle();
    ASSERT_TRUE(platform::PostMessage(handle, kMsg, 1, 0));
    other.reset();
    EXPECT_FALSE(platform::PostMessage(handle, kMsg, 2, 0));
    EXPECT_EQ(platform::PumpPendingMessages(), 0);
    EXPECT_FALSE(platform::PostMessage(nullptr, kMsg, 3, 0));
}

TEST_F(MessageLoop, TimersTickWithTheirPeriodReArmingReplacesAndKillKeepsAQueuedTick) {
    EXPECT_EQ(platform::SetTimer(w.Handle(), 0, 10), 0u);
    EXPECT_EQ(platform::SetTimer(nullptr, 3, 10), 0u);
    const uint64_t start = platform::GetTickCount64();
    platform::SetTimer(w.Handle(), 1234, 60000);
    ASSERT_EQ(platform::SetTimer(w.Handle(), 1234, 50), 1234u);
    ASSERT_TRUE(
        platform::RunMessageLoopUntil([&] { return w.Count(platform::WM_TIMER) >= 3; }, 2000));
    EXPECT_EQ(w.received[0].wParam, 1234u);
    EXPECT_EQ(w.received[0].lParam, 0);
    // Three ticks of 50 ms cannot come sooner than 150 ms after arming.
    EXPECT_GE(w.received[2].tick - start, 145u);
    EXPECT_TRUE(platform::KillTimer(w.Handle(), 1234));
    EXPECT_FALSE(platform::KillTimer(w.Handle(), 1234));
    w.received.clear();

    // A message handled first kills the timer; the tick queued behind it still arrives, once.
    platform::SetTimer(w.Handle(), 5, 20);
    ASSERT_TRUE(platform::PostMessage(w.Handle(), kMsg, 0, 0));
    platform::Sleep(60);
    w.onMessage = [&](UINT m, WPARAM) {
        if (m == kMsg) {
            platform::KillTimer(w.Handle(), 5);
        }
    };
    platform::PumpPendingMessages();
    EXPECT_EQ(w.Count(kMsg), 1u);
    EXPECT_EQ(w.Count(platform::WM_TIMER), 1u);
    EXPECT_FALSE(platform::RunMessageLoopUntil([] { return false; }, 100));
    EXPECT_EQ(w.Count(platform::WM_TIMER), 1u);
}

TEST_F(MessageLoop, DescriptorIsReadableExactlyWhileWorkIsPending) {
    const int fd = platform::MessageQueueDescriptor();
    platform::PumpPendingMessages();
    EXPECT_EQ(platform::WaitReadable(fd, 0), platform::WaitResult::Timeout);
    std::thread([h = w.Handle()] { platform::PostMessage(h, kMsg, 0, 0); }).join();
    EXPECT_EQ(platform::WaitReadable(fd, 1000), platform::WaitResult::Signaled);
    platform::PumpPendingMessages();
    EXPECT_EQ(platform::WaitReadable(fd, 0), platform::WaitResult::Timeout);
    // A due timer makes it readable too, without anyone posting.
    platform::SetTimer(w.Handle(), 9, 30);
    EXPECT_EQ(platform::WaitReadable(fd, 1000), platform::WaitResult::Signaled);
    platform::KillTimer(w.Handle(), 9);
}

TEST_F(MessageLoop, HandlerMayPumpNestedAndQuitEndsTheLoop) {
    w.onMessage = [&](UINT m, WPARAM wp) {
        if (m == kMsg && wp == 1) {
            platform::PostMessage(w.Handle(), kMsg, 2, 0);
            // A nested loop sees the message posted from inside the handler.
            EXPECT_TRUE(platform::RunMessageLoopUntil([&] { return w.Count(kMsg) == 2; }, 1000));
            platform::QuitMessageLoop();
        }
    };
    platform::PostMessage(w.Handle(), kMsg, 1, 0);
    platform::RunMessageLoop();
    EXPECT_EQ(w.Count(kMsg), 2u);
}

TEST_F(MessageLoop, WindowsOfAnotherThreadAreHandledThere) {
    std::atomic<platform::WindowHandle> handle{nullptr};
    platform::Event created;
    std::atomic<uint32_t> handledOn{0};
    std::atomic<bool> done{false};
    platform::Thread owner;
    ASSERT_TRUE(owner.Start([&] {
        RecordingWindow w;
        w.CreateMessageWindow();
        w.onMessage = [&](UINT, WPARAM) {
            handledOn = platform::GetCurrentThreadId();
            done = true;
        };
        handle = w.Handle();
        created.Set();
        platform::RunMessageLoopUntil([&] { return done.load(); }, 5000);
    }));
    ASSERT_EQ(created.Wait(5000), platform::WaitResult::Signaled);
    ASSERT_TRUE(platform::PostMessage(handle, kMsg, 0, 0));
    // This thread has no window of its own; pumping here must not steal the message.
    platform::PumpPendingMessages();
    owner.Join();
    EXPECT_TRUE(done);
    EXPECT_NE(handledOn.load(), platform::GetCurrentThreadId());
}

}  // namespace
