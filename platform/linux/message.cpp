#include "platform/message.h"

#include <poll.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <deque>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "platform/kernel.h"
#include "platform/linux/threadslot.h"

namespace platform {

namespace {

struct QueuedMessage {
    WindowHandle window;
    UINT message;
    WPARAM wParam;
    LPARAM lParam;
};

struct Timer {
    WindowHandle window;
    uintptr_t id;
    uint32_t period;
    uint64_t due;
};

// One per thread that owns windows: posted messages, its windows' timers, and the descriptors a
// host can watch.
class Queue {
  public:
    Queue()
        : eventFd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
          timerFd_(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK)),
          epollFd_(epoll_create1(EPOLL_CLOEXEC)) {
        epoll_event ev{};
        ev.events = EPOLLIN;
        ev.data.fd = eventFd_;
        epoll_ctl(epollFd_, EPOLL_CTL_ADD, eventFd_, &ev);
        ev.data.fd = timerFd_;
        epoll_ctl(epollFd_, EPOLL_CTL_ADD, timerFd_, &ev);
    }
    ~Queue() {
        close(epollFd_);
        close(timerFd_);
        close(eventFd_);
    }
    Queue(const Queue&) = delete;
    Queue& operator=(const Queue&) = delete;

    int Descriptor() const { return epollFd_; }

    void Post(const QueuedMessage& m) {
        std::lock_guard<std::mutex> lock(mutex_);
        messages_.push_back(m);
        uint64_t one = 1;
        [[maybe_unused]] ssize_t n = write(eventFd_, &one, sizeof one);
    }

    void SetTimer(WindowHandle window, uintptr_t id, uint32_t period) {
        std::lock_guard<std::mutex> lock(mutex_);
        const uint64_t due = GetTickCount64() + period;
        auto it = FindTimer(window, id);
        if (it != timers_.end()) {
            it->period = period;
            it->due = due;
        } else {
            timers_.push_back(Timer{window, id, period, due});
        }
        RearmLocked();
    }

    bool KillTimer(WindowHandle window, uintptr_t id) {
        std::lock_guard<std::mutex> lock(mutex_);
        auto it = FindTimer(window, id);
        if (it == timers_.end()) {
            return false;
        }
        timers_.erase(it);
        RearmLocked();
        return true;
    }

    void DropWindow(WindowHandle window) {
        std::lock_guard<std::mutex> lock(mutex_);
        std::erase_if(timers_, [window](const Timer& t) { return t.window == window; });
        std::erase_if(messages_, [window](const QueuedMessage& m) { return m.window == window; });
        RearmLocked();
    }

    // Queues one WM_TIMER for every due timer that has none queued yet, as Windows coalesces
    // ticks that the thread did not get round to.
    void QueueDueTimers() {
        std::lock_guard<std::mutex> lock(mutex_);
        uint64_t expirations = 0;
        [[maybe_unused]] ssize_t n = read(timerFd_, &expirations, sizeof expirations);
        const uint64_t now = GetTickCount64();
        for (auto& t : timers_) {
            if (t.due > now) {
                continue;
            }
            t.due = now + t.period;
            const bool queued =
                std::any_of(messages_.begin(), messages_.end(), [&t](const QueuedMessage& m) {
                    return m.window == t.window && m.message == WM_TIMER && m.wParam == t.id;
                });
            if (!queued) {
                messages_.push_back(QueuedMessage{t.window, WM_TIMER, t.id, 0});
            }
        }
        RearmLocked();
    }

    bool Pop(QueuedMessage& out) {
        std::lock_guard<std::mutex> lock(mutex_);
        if (messages_.empty()) {
            uint64_t value = 0;
            [[maybe_unused]] ssize_t n = read(eventFd_, &value, sizeof value);
            return false;
        }
        out = messages_.front();
        messages_.pop_front();
        return true;
    }

    bool quit = false;  // touched only by the owning thread

  private:
    std::vector<Timer>::iterator FindTimer(WindowHandle window, uintptr_t id) {
        return std::find_if(timers_.begin(), timers_.end(), [window, id](const Timer& t) {
            return t.window == window && t.id == id;
        });
    }

    void RearmLocked() {
        itimerspec when{};
        if (!timers_.empty()) {
            uint64_t earliest = timers_.front().due;
            for (const auto& t : timers_) {
                earliest = std::min(earliest, t.due);
            }
            // Absolute monotonic time; zero would disarm, so never pass it.
            const uint64_t at = std::max<uint64_t>(earliest, 1);
            when.it_value.tv_sec = static_cast<time_t>(at / 1000);
            when.it_value.tv_nsec = static_cast<long>((at % 1000) * 1000000);
        }
        timerfd_settime(timerFd_, TFD_TIMER_ABSTIME, &when, nullptr);
    }

    std::mutex mutex_;
    std::deque<QueuedMessage> messages_;
    std::vector<Timer> timers_;
    int eventFd_;
    int timerFd_;
    int epollFd_;
};

struct WindowRecord {
    std::shared_ptr<Queue> queue;
    MessageWindow* window;
};

std::mutex g_windowsMutex;
std::unordered_map<WindowHandle, WindowRecord> g_windows;
std::atomic<uintptr_t> g_nextHandle{1};

// Each thread's queue; not a thread_local, so that the module can unload.
ThreadSlot<std::shared_ptr<Queue>> g_queues;

std::shared_ptr<Queue>& ThisQueuePointer() {
    std::shared_ptr<Queue>* queue = g_queues.Get();
    if (queue == nullptr) {
        // No thread key left in the process: the threads share one queue rather than none.
        static std::shared_ptr<Queue> shared = std::make_shared<Queue>();
        return shared;
    }
    if (!*queue) {
        *queue = std::make_shared<Queue>();
    }
    return *queue;
}

// SIGINT and SIGTERM as a descriptor, once routed; it stays readable from the first signal on, so
// every loop that watches it ends.
std::atomic<int> g_interruptFd{-1};

bool InterruptPending() {
    const int fd = g_interruptFd.load();
    if (fd < 0) {
        return false;
    }
    pollfd p{fd, POLLIN, 0};
    return poll(&p, 1, 0) == 1;
}

Queue& ThisQueue() {
    return *ThisQueuePointer();
}

std::shared_ptr<Queue> QueueOf(WindowHandle window) {
    std::lock_guard<std::mutex> lock(g_windowsMutex);
    auto it = g_windows.find(window);
    return it == g_windows.end() ? nullptr : it->second.queue;
}

void Dispatch(const QueuedMessage& m) {
    MessageWindow* target = nullptr;
    {
        std::lock_guard<std::mutex> lock(g_windowsMutex);
        auto it = g_windows.find(m.window);
        // Only the owning thread handles a window's messages.
        if (it != g_windows.end() && it->second.queue == ThisQueuePointer()) {
            target = it->second.window;
        }
    }
    if (target != nullptr) {
        bool handled = true;
        target->WindowProc(m.message, m.wParam, m.lParam, handled);
    }
}

int PumpImpl(const std::function<bool()>* done) {
    Queue& q = ThisQueue();
    q.QueueDueTimers();
    int delivered = 0;
    QueuedMessage m{};
    while (q.Pop(m)) {
        Dispatch(m);
        ++delivered;
        if ((done != nullptr && (*done)()) || q.quit) {
            break;
        }
    }
    return delivered;
}

}  // namespace

MessageWindow::~MessageWindow() {
    DestroyMessageWindow();
}

bool MessageWindow::CreateMessageWindow() {
    if (handle_ != nullptr) {
        return true;
    }
    const std::shared_ptr<Queue> queue = ThisQueuePointer();
    const auto handle = reinterpret_cast<WindowHandle>(g_nextHandle.fetch_add(1));
    std::lock_guard<std::mutex> lock(g_windowsMutex);
    g_windows.emplace(handle, WindowRecord{queue, this});
    handle_ = handle;
    return true;
}

void MessageWindow::DestroyMessageWindow() {
    if (handle_ == nullptr) {
        return;
    }
    std::shared_ptr<Queue> queue;
    {
        std::lock_guard<std::mutex> lock(g_windowsMutex);
        auto it = g_windows.find(handle_);
        if (it != g_windows.end()) {
            queue = it->second.queue;
            g_windows.erase(it);
        }
    }
    if (queue) {
        queue->DropWindow(handle_);
    }
    handle_ = nullptr;
}

bool PostMessage(WindowHandle window, UINT message, WPARAM wParam, LPARAM lParam) {
    // Held across the post so a window destroyed meanwhile cannot receive it.
    std::lock_guard<std::mutex> lock(g_windowsMutex);
    auto it = g_windows.find(window);
    if (it == g_windows.end()) {
        return false;
    }
    it->second.queue->Post(QueuedMessage{window, message, wParam, lParam});
    return true;
}

uintptr_t SetTimer(WindowHandle window, uintptr_t id, uint32_t periodMs) {
    if (id == 0) {
        return 0;
    }
    auto queue = QueueOf(window);
    if (!queue) {
        return 0;
    }
    queue->SetTimer(window, id, periodMs);
    return id;
}

bool KillTimer(WindowHandle window, uintptr_t id) {
    auto queue = QueueOf(window);
    return queue && queue->KillTimer(window, id);
}

int MessageQueueDescriptor() {
    return ThisQueue().Descriptor();
}

int PumpPendingMessages() {
    return PumpImpl(nullptr);
}

bool RunMessageLoopUntil(const std::function<bool()>& done, int timeoutMs) {
    Queue& q = ThisQueue();
    const uint64_t deadline =
        timeoutMs < 0 ? 0 : GetTickCount64() + static_cast<uint64_t>(timeoutMs);
    for (;;) {
        if (done()) {
            return true;
        }
        PumpImpl(&done);
        if (done()) {
            return true;
        }
        if (q.quit) {
            q.quit = false;
            return false;
        }
        if (InterruptPending()) {
            return done();
        }
        int wait = -1;
        if (timeoutMs >= 0) {
            const uint64_t now = GetTickCount64();
            if (now >= deadline) {
                return false;
            }
            wait = static_cast<int>(deadline - now);
        }
        const WaitResult r = WaitReadable(q.Descriptor(), wait);
        if (r == WaitResult::Stopped || r == WaitResult::Failed) {
            return done();
        }
    }
}

void RunMessageLoop() {
    RunMessageLoopUntil([] { return false; }, -1);
}

void QuitMessageLoop() {
    ThisQueue().quit = true;
}

bool RouteInterruptsToMessageLoop() {
    static const int fd = [] {
        sigset_t set;
        sigemptyset(&set);
        sigaddset(&set, SIGINT);
        sigaddset(&set, SIGTERM);
        // Blocked in every thread started later, so the signal stays pending for the descriptor.
        if (pthread_sigmask(SIG_BLOCK, &set, nullptr) != 0) {
            return -1;
        }
        return signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
    }();
    if (fd < 0) {
        return false;
    }
    g_interruptFd.store(fd);
    // The calling thread's loop wakes on it; a second call on the same thread adds nothing.
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.fd = fd;
    return epoll_ctl(ThisQueue().Descriptor(), EPOLL_CTL_ADD, fd, &ev) == 0 || errno == EEXIST;
}

bool WatchInMessageLoop(int fd) {
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.fd = fd;
    return epoll_ctl(ThisQueue().Descriptor(), EPOLL_CTL_ADD, fd, &ev) == 0 || errno == EEXIST;
}

bool InterruptRequested() {
    return InterruptPending();
}

}  // namespace platform
