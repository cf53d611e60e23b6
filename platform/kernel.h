// Kernel services: time, thread identity, debugger output, events, critical sections and
// threads whose blocking waits can be interrupted by their owner's stop request.
#pragma once

#include "platform/system_names.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

namespace platform {

// Milliseconds since an arbitrary fixed point (monotonic); the 32-bit form wraps like Windows'.
uint64_t GetTickCount64();
inline uint32_t GetTickCount() {
    return static_cast<uint32_t>(GetTickCount64());
}

struct LocalTime {
    int year;
    int month;  // 1..12
    int day;
    int hour;
    int minute;
    int second;
    int milliseconds;
};
LocalTime GetLocalTime();

uint32_t GetCurrentThreadId();

// The debugger output: discarded unless a host installs a sink (the CLI installs stderr on
// request). The sink may be called from any thread.
using DebugOutputSink = std::function<void(std::string_view line)>;
void SetDebugOutputSink(DebugOutputSink sink);
void OutputDebugString(std::string_view line);

// A stop request that blocking waits watch together with what they wait for. Each Thread owns
// one; the thread's body sees it as the current stop source.
class StopSource {
  public:
    StopSource();
    ~StopSource();
    StopSource(const StopSource&) = delete;
    StopSource& operator=(const StopSource&) = delete;

    void RequestStop();
    bool StopRequested() const;
    int Descriptor() const { return fd_; }  // readable once a stop was requested

  private:
    int fd_;
};

// The stop source of the calling thread, or null on threads not started by Thread.
const StopSource* CurrentStopSource();
bool CurrentThreadStopRequested();

enum class WaitResult { Signaled, Timeout, Stopped, Failed };

// Waits until the descriptor is readable, the timeout (ms, -1 = none) passes, or the calling
// thread is asked to stop.
WaitResult WaitReadable(int fd, int timeoutMs);

// Sleep that ends early with Stopped when the calling thread is asked to stop.
WaitResult Sleep(int milliseconds);

// Auto-reset (or manual-reset) event, created unsignalled unless asked otherwise.
class Event {
  public:
    explicit Event(bool manualReset = false, bool initialState = false);
    ~Event();
    Event(const Event&) = delete;
    Event& operator=(const Event&) = delete;

    bool IsValid() const { return fd_ >= 0; }
    // The system's error code when the event could not be created, else 0.
    int Error() const { return error_; }
    void Set();
    void Reset();
    // An auto-reset event is consumed by the waiter that sees it.
    WaitResult Wait(int timeoutMs);

  private:
    int fd_;
    int error_;
    bool manualReset_;
};

// Reentrant critical section.
class CriticalSection {
  public:
    void Enter() { mutex_.lock(); }
    void Leave() { mutex_.unlock(); }
    // BasicLockable, so std::lock_guard and std::unique_lock work.
    void lock() { mutex_.lock(); }
    void unlock() { mutex_.unlock(); }

  private:
    std::recursive_mutex mutex_;
};
using CriticalSectionLock = std::lock_guard<CriticalSection>;

// A thread that can be asked to stop and is always joined, never killed.
class Thread {
  public:
    Thread() = default;
    ~Thread() { Stop(); }
    Thread(const Thread&) = delete;
    Thread& operator=(const Thread&) = delete;

    // False if a thread is already held or the system refused to create one (errno then says
    // why).
    bool Start(std::function<void()> body);
    void RequestStop();
    void Join();
    // Request the stop, wake the thread's waits, join it.
    void Stop() {
        RequestStop();
        Join();
    }
    bool IsStarted() const { return thread_.joinable(); }
    bool HasFinished() const;
    bool IsCurrentThread() const { return thread_.get_id() == std::this_thread::get_id(); }

  private:
    struct State;
    std::shared_ptr<State> state_;
    std::thread thread_;
};

// A per-thread pointer slot, like TlsAlloc: each slot has its own value on every thread.
class ThreadLocalSlot {
  public:
    ThreadLocalSlot();
    ~ThreadLocalSlot();
    ThreadLocalSlot(const ThreadLocalSlot&) = delete;
    ThreadLocalSlot& operator=(const ThreadLocalSlot&) = delete;

    void* Get() const;
    void Set(void* value);

  private:
    unsigned key_;
    bool valid_;
};

}  // namespace platform
