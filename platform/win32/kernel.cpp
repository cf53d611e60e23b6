#include "platform/kernel.h"

#include <windows.h>

#include <atomic>
#include <cerrno>
#include <system_error>

#include "platform/win32/handle.h"

namespace platform {

std::wstring Wide(std::string_view utf8) {
    if (utf8.empty() || utf8.size() > 0x7FFFFFFF) {
        return {};
    }
    const int n =
        MultiByteToWideChar(CP_UTF8, 0, utf8.data(), static_cast<int>(utf8.size()), nullptr, 0);
    std::wstring out(static_cast<size_t>(n > 0 ? n : 0), L'\0');
    if (n > 0) {
        MultiByteToWideChar(CP_UTF8, 0, utf8.data(), static_cast<int>(utf8.size()), out.data(), n);
    }
    return out;
}

std::string Utf8(std::wstring_view wide) {
    if (wide.empty() || wide.size() > 0x7FFFFFFF) {
        return {};
    }
    const int n = WideCharToMultiByte(CP_UTF8, 0, wide.data(), static_cast<int>(wide.size()),
                                      nullptr, 0, nullptr, nullptr);
    std::string out(static_cast<size_t>(n > 0 ? n : 0), '\0');
    if (n > 0) {
        WideCharToMultiByte(CP_UTF8, 0, wide.data(), static_cast<int>(wide.size()), out.data(), n,
                            nullptr, nullptr);
    }
    return out;
}

std::string SystemErrorText(DWORD error) {
    wchar_t* text = nullptr;
    const DWORD n = FormatMessageW(
        FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
        nullptr, error, 0, reinterpret_cast<wchar_t*>(&text), 0, nullptr);
    std::string out = n > 0 ? Utf8(std::wstring_view(text, n)) : "error " + std::to_string(error);
    LocalFree(text);
    while (!out.empty() && (out.back() == '\n' || out.back() == '\r' || out.back() == ' ')) {
        out.pop_back();
    }
    return out;
}

uint64_t GetTickCount64() {
    return ::GetTickCount64();
}

LocalTime GetLocalTime() {
    SYSTEMTIME t{};
    ::GetLocalTime(&t);
    return LocalTime{t.wYear, t.wMonth, t.wDay, t.wHour, t.wMinute, t.wSecond, t.wMilliseconds};
}

uint32_t GetCurrentThreadId() {
    return ::GetCurrentThreadId();
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
    // The debugger sees every line, as on any Windows program; a host's sink gets it too.
    ::OutputDebugStringW(Wide(line).c_str());
    std::lock_guard<std::mutex> lock(g_sinkMutex);
    if (g_sink) {
        g_sink(line);
    }
}

StopSource::StopSource() : fd_(DescriptorOf(CreateEventW(nullptr, TRUE, FALSE, nullptr))) {}

StopSource::~StopSource() {
    if (fd_ >= 0) {
        CloseHandle(HandleOf(fd_));
    }
}

void StopSource::RequestStop() {
    if (fd_ >= 0) {
        SetEvent(HandleOf(fd_));
    }
}

bool StopSource::StopRequested() const {
    return fd_ >= 0 && WaitForSingleObject(HandleOf(fd_), 0) == WAIT_OBJECT_0;
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
// Waits for the handle (-1: none, a pure sleep) together with the current stop source.
WaitResult WaitWithStop(int fd, int timeoutMs) {
    HANDLE handles[2];
    DWORD n = 0;
    if (fd >= 0) {
        handles[n++] = HandleOf(fd);
    }
    const DWORD stopIndex = n;
    if (t_stop != nullptr && t_stop->Descriptor() >= 0) {
        handles[n++] = HandleOf(t_stop->Descriptor());
    }
    const DWORD wait = timeoutMs < 0 ? INFINITE : static_cast<DWORD>(timeoutMs);
    if (n == 0) {
        ::Sleep(wait);
        return WaitResult::Timeout;
    }
    const DWORD r = WaitForMultipleObjects(n, handles, FALSE, wait);
    if (r == WAIT_TIMEOUT) {
        return WaitResult::Timeout;
    }
    if (r >= WAIT_OBJECT_0 && r < WAIT_OBJECT_0 + n) {
        // The stop wins when both are set, so that an owner's stop is never missed.
        if (stopIndex < n && WaitForSingleObject(handles[stopIndex], 0) == WAIT_OBJECT_0) {
            return WaitResult::Stopped;
        }
        return WaitResult::Signaled;
    }
    return WaitResult::Failed;
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
    : fd_(DescriptorOf(
          CreateEventW(nullptr, manualReset ? TRUE : FALSE, initialState ? TRUE : FALSE, nullptr))),
      error_(fd_ < 0 ? static_cast<int>(GetLastError()) : 0),
      manualReset_(manualReset) {}

Event::~Event() {
    if (fd_ >= 0) {
        CloseHandle(HandleOf(fd_));
    }
}

void Event::Set() {
    if (fd_ >= 0) {
        SetEvent(HandleOf(fd_));
    }
}

void Event::Reset() {
    if (fd_ >= 0) {
        ResetEvent(HandleOf(fd_));
    }
}

WaitResult Event::Wait(int timeoutMs) {
    if (fd_ < 0) {
        return WaitResult::Failed;
    }
    // The kernel consumes an auto-reset event for the one waiter it wakes.
    return WaitWithStop(fd_, timeoutMs);
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
        errno = e.code().value();
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

ThreadLocalSlot::ThreadLocalSlot() : key_(TlsAlloc()), valid_(key_ != TLS_OUT_OF_INDEXES) {}

ThreadLocalSlot::~ThreadLocalSlot() {
    if (valid_) {
        TlsFree(key_);
    }
}

void* ThreadLocalSlot::Get() const {
    return valid_ ? TlsGetValue(key_) : nullptr;
}

void ThreadLocalSlot::Set(void* value) {
    if (valid_) {
        TlsSetValue(key_, value);
    }
}

}  // namespace platform
