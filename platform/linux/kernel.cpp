#include "platform/kernel.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>

namespace platform {

uint64_t GetTickCount64() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<uint64_t>(ts.tv_sec) * 1000u + static_cast<uint64_t>(ts.tv_nsec) / 1000000u;
}

LocalTime GetLocalTime() {
    timespec ts{};
    clock_gettime(CLOCK_REALTIME, &ts);
    tm parts{};
    time_t secs = ts.tv_sec;
    localtime_r(&secs, &parts);
    return LocalTime{parts.tm_year + 1900,
                     parts.tm_mon + 1,
                     parts.tm_mday,
                     parts.tm_hour,
                     parts.tm_min,
                     parts.tm_sec,
                     static_cast<int>(ts.tv_nsec / 1000000)};
}

uint32_t GetCurrentThreadId() {
    return static_cast<uint32_t>(syscall(SYS_gettid));
}

namespace {
std::mutex g_sinkMutex;
DebugOutputSink g_sink;
}  // namespace

void SetDebugOutputSink(DebugOutputSink sink) {
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    g_sink = std::move(sink);
}

void OutputDebugString(std::string_view line) {
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    if (g_sink) {
        g_sink(line);
    }
}

StopSource::StopSource() : fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

StopSource::~StopSource() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

void StopSource::RequestStop() {
    if (fd_ >= 0) {
        uint64_t one = 1;
        [[maybe_unused]] ssize_t n = write(fd_, &one, sizeof one);
    }
}

bool StopSource::StopRequested() const {
    if (fd_ < 0) {
        return false;
    }
    pollfd p{fd_, POLLIN, 0};
    return poll(&p, 1, 0) == 1;
}

namespace {
thread_local const StopSource* t_stop = nullptr;
}

const StopSource* CurrentStopSource() {
    return t_stop;
}

bool CurrentThreadStopRequested() {
    return t_stop != nullptr && t_stop->StopRequested();
}

namespace {
// Waits for fd (may be -1 for a pure sleep) together with the current stop source.
WaitResult WaitWithStop(int fd, int timeoutMs) {
    const uint64_t deadline =
        timeoutMs < 0 ? 0 : GetTickCount64() + static_cast<uint64_t>(timeoutMs);
    for (;;) {
        pollfd fds[2];
        nfds_t n = 0;
        if (fd >= 0) {
            fds[n++] = pollfd{fd, POLLIN, 0};
        }
        const int stopIndex = t_stop != nullptr ? static_cast<int>(n) : -1;
        if (t_stop != nullptr) {
            fds[n++] = pollfd{t_stop->Descriptor(), POLLIN, 0};
        }
        int wait = -1;
        if (timeoutMs >= 0) {
            const uint64_t now = GetTickCount64();
            wait = now >= deadline ? 0 : static_cast<int>(deadline - now);
        }
        const int r = poll(fds, n, wait);
        if (r < 0) {
            if (errno == EINTR) {
                continue;
            }
            return WaitResult::Failed;
        }
        if (r == 0) {
            return WaitResult::Timeout;
        }
        if (stopIndex >= 0 && (fds[stopIndex].revents & POLLIN) != 0) {
            return WaitResult::Stopped;
        }
        if (fd >= 0 && fds[0].revents != 0) {
            return WaitResult::Signaled;
        }
    }
}
}  // namespace

WaitResult WaitReadable(int fd, int timeoutMs) {
    if (fd < 0) {
        return WaitResult::Failed;
    }
    return WaitWithStop(fd, timeoutMs);
}

WaitResult Sleep(int milliseconds) {
    return WaitWithStop(-1, milliseconds < 0 ? 0 : milliseconds);
}

Event::Event(bool manualReset, bool initialState)
    : fd_(eventfd(initialState ? 1 : 0, EFD_CLOEXEC | EFD_NONBLOCK)),
      error_(fd_ < 0 ? errno : 0),
      manualReset_(manualReset) {}

Event::~Event() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

void Event::Set() {
    if (fd_ < 0) {
        return;
    }
    // A read drains the whole counter, so setting twice still wakes one waiter once.
    uint64_t one = 1;
    [[maybe_unused]] ssize_t n = write(fd_, &one, sizeof one);
}

void Event::Reset() {
    if (fd_ < 0) {
        return;
    }
    uint64_t value = 0;
    [[maybe_unused]] ssize_t n = read(fd_, &value, sizeof value);
}

WaitResult Event::Wait(int timeoutMs) {
    if (fd_ < 0) {
        return WaitResult::Failed;
    }
    const uint64_t start = GetTickCount64();
    for (;;) {
        int remaining = timeoutMs;
        if (timeoutMs >= 0) {
            const uint64_t spent = GetTickCount64() - start;
            remaining =
                spent >= static_cast<uint64_t>(timeoutMs) ? 0 : timeoutMs - static_cast<int>(spent);
        }
        const WaitResult r = WaitWithStop(fd_, remaining);
        if (r != WaitResult::Signaled || manualReset_) {
            return r;
        }
        uint64_t value = 0;
        if (read(fd_, &value, sizeof value) == static_cast<ssize_t>(sizeof value)) {
            return WaitResult::Signaled;
        }
        // Another waiter took it first: keep waiting for the rest of the time.
    }
}

struct Thread::State {
    StopSource stop;
    std::atomic<bool> finished{false};
};

bool Thread::Start(std::function<void()> body) {
    if (thread_.joinable()) {
        return false;
    }
    auto state = std::make_shared<State>();
    if (state->stop.Descriptor() < 0) {
        return false;
    }
    try {
        thread_ = std::thread([state, body = std::move(body)] {
            t_stop = &state->stop;
            body();
            t_stop = nullptr;
            state->finished.store(true);
        });
    } catch (const std::system_error& e) {
        errno = e.code().value();  // for callers that report the system's reason
        return false;
    }
    state_ = std::move(state);
    return true;
}

void Thread::RequestStop() {
    if (state_) {
        state_->stop.RequestStop();
    }
}

void Thread::Join() {
    if (thread_.joinable() && thread_.get_id() != std::this_thread::get_id()) {
        thread_.join();
        state_.reset();
    }
}

bool Thread::HasFinished() const {
    return !state_ || state_->finished.load();
}

ThreadLocalSlot::ThreadLocalSlot() : key_(0), valid_(false) {
    pthread_key_t key;
    if (pthread_key_create(&key, nullptr) == 0) {
        key_ = static_cast<unsigned>(key);
        valid_ = true;
    }
}

ThreadLocalSlot::~ThreadLocalSlot() {
    if (valid_) {
        pthread_key_delete(static_cast<pthread_key_t>(key_));
    }
}

void* ThreadLocalSlot::Get() const {
    return valid_ ? pthread_getspecific(static_cast<pthread_key_t>(key_)) : nullptr;
}

void ThreadLocalSlot::Set(void* value) {
    if (valid_) {
        pthread_setspecific(static_cast<pthread_key_t>(key_), value);
    }
}

}  // namespace platform
