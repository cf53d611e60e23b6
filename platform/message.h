// The message layer: message-only windows owned by a thread, messages posted to them from any
// thread, timers that tick as WM_TIMER messages, and the loop the owning thread pumps.
//
// A host that runs its own event loop (GLib, Qt, libuv, epoll) watches MessageQueueDescriptor()
// of the thread that owns the windows and calls PumpPendingMessages() when it becomes readable.
#pragma once

#include "platform/system_names.h"

#include <cstdint>
#include <functional>

namespace platform {

using UINT = uint32_t;
using WPARAM = uintptr_t;
using LPARAM = intptr_t;
using LRESULT = intptr_t;

// Opaque window handle; null is no window. Handles are never reused within a process, so a
// message posted to a destroyed window is simply lost.
using WindowHandle = struct WindowHandleTag*;

inline constexpr UINT WM_TIMER = 0x0113;
inline constexpr UINT WM_USER = 0x0400;

// A message-only window. The thread that calls Create owns it: its messages are handled there.
class MessageWindow {
  public:
    MessageWindow() = default;
    virtual ~MessageWindow();
    MessageWindow(const MessageWindow&) = delete;
    MessageWindow& operator=(const MessageWindow&) = delete;

    bool CreateMessageWindow();
    // Kills the window's timers; messages still queued for it are dropped.
    void DestroyMessageWindow();
    WindowHandle Handle() const { return handle_; }

    // Called on the owning thread. Set handled to false to get the default result (0).
    virtual LRESULT WindowProc(UINT message, WPARAM wParam, LPARAM lParam, bool& handled) = 0;

  private:
    WindowHandle handle_ = nullptr;
};

// Any thread. False when the window does not exist (any more).
bool PostMessage(WindowHandle window, UINT message, WPARAM wParam, LPARAM lParam);

// Arms timer `id` of the window with the period; re-arming an id replaces its timer. Returns the
// id, or 0 for an unknown window or an id of 0.
uintptr_t SetTimer(WindowHandle window, uintptr_t id, uint32_t periodMs);
// Stops the timer. A tick already queued is still delivered, as on Windows.
bool KillTimer(WindowHandle window, uintptr_t id);

// The calling thread's loop.
// Readable while a message is queued or a timer is due for this thread's windows.
int MessageQueueDescriptor();
// Delivers what is queued and due now; returns the number of messages delivered.
int PumpPendingMessages();
// Pumps until done() is true (checked after every message) or the timeout (ms, -1 = none)
// passes, or the thread is asked to stop. Returns done().
bool RunMessageLoopUntil(const std::function<bool()>& done, int timeoutMs);
// Pumps until QuitMessageLoop() is called on this thread (or the thread is asked to stop).
void RunMessageLoop();
void QuitMessageLoop();

// Wakes the calling thread's loop too while fd is readable (another loop's descriptor, say), so
// that the done() of RunMessageLoopUntil can serve it. False when it cannot be watched.
bool WatchInMessageLoop(int fd);

// Makes Ctrl-C (SIGINT) and SIGTERM a source of the calling thread's loop: from this call on
// they no longer end the process; once one arrives, RunMessageLoop and RunMessageLoopUntil on
// this thread return at once (and so does every later call), and InterruptRequested() is true.
// Call it before any other thread starts, so that every thread leaves the signals to the loop.
// False when the signals cannot be redirected.
bool RouteInterruptsToMessageLoop();
bool InterruptRequested();

}  // namespace platform
