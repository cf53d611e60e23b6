#include "platform/message.h"

#include <windows.h>

#include <atomic>
#include <vector>

#include "platform/kernel.h"
#include "platform/win32/handle.h"

namespace platform {

namespace {

constexpr wchar_t kClassName[] = L"NqPortManagerMessageWindow";

HWND Hwnd(WindowHandle window) {
    return reinterpret_cast<HWND>(window);
}

LRESULT CALLBACK Procedure(HWND hwnd, UINT message, WPARAM wParam, LPARAM lParam) {
    auto* target = reinterpret_cast<MessageWindow*>(GetWindowLongPtrW(hwnd, GWLP_USERDATA));
    if (target != nullptr) {
        bool handled = true;
        const LRESULT result = target->WindowProc(message, wParam, lParam, handled);
        if (handled) {
            return result;
        }
    }
    return DefWindowProcW(hwnd, message, wParam, lParam);
}

HINSTANCE ThisModule() {
    HMODULE module = nullptr;
    GetModuleHandleExW(
        GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS | GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
        reinterpret_cast<LPCWSTR>(&Procedure), &module);
    return module;
}

// Registered once per module; a second registration by the same module fails harmlessly.
bool RegisterWindowClass() {
    static const bool registered = [] {
        WNDCLASSEXW wc{};
        wc.cbSize = sizeof wc;
        wc.lpfnWndProc = Procedure;
        wc.hInstance = ThisModule();
        wc.lpszClassName = kClassName;
        return RegisterClassExW(&wc) != 0 || GetLastError() == ERROR_CLASS_ALREADY_EXISTS;
    }();
    return registered;
}

// Per thread: the quit request and the extra handles its loop also wakes for.
thread_local bool t_quit = false;
thread_local std::vector<HANDLE> t_watched;

// Ctrl-C, Ctrl-Break and the console's close as a manual-reset event, once routed.
std::atomic<HANDLE> g_interrupt{nullptr};

BOOL WINAPI ConsoleControl(DWORD) {
    if (HANDLE e = g_interrupt.load()) {
        SetEvent(e);
        return TRUE;
    }
    return FALSE;
}

bool InterruptPending() {
    HANDLE e = g_interrupt.load();
    return e != nullptr && WaitForSingleObject(e, 0) == WAIT_OBJECT_0;
}

int PumpImpl(const std::function<bool()>* done) {
    int delivered = 0;
    MSG msg{};
    while (PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
        if (msg.message == WM_QUIT) {
            t_quit = true;
            break;
        }
        TranslateMessage(&msg);
        DispatchMessageW(&msg);
        ++delivered;
        if ((done != nullptr && (*done)()) || t_quit) {
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
    if (!RegisterWindowClass()) {
        return false;
    }
    HWND hwnd = CreateWindowExW(0, kClassName, L"", 0, 0, 0, 0, 0, HWND_MESSAGE, nullptr,
                                ThisModule(), nullptr);
    if (hwnd == nullptr) {
        return false;
    }
    SetWindowLongPtrW(hwnd, GWLP_USERDATA, reinterpret_cast<LONG_PTR>(this));
    handle_ = reinterpret_cast<WindowHandle>(hwnd);
    return true;
}

void MessageWindow::DestroyMessageWindow() {
    if (handle_ == nullptr) {
        return;
    }
    HWND hwnd = Hwnd(handle_);
    SetWindowLongPtrW(hwnd, GWLP_USERDATA, 0);
    DestroyWindow(hwnd);  // its timers and queued messages go with it
    handle_ = nullptr;
}

bool PostMessage(WindowHandle window, UINT message, WPARAM wParam, LPARAM lParam) {
    return window != nullptr && PostMessageW(Hwnd(window), message, wParam, lParam) != FALSE;
}

uintptr_t SetTimer(WindowHandle window, uintptr_t id, uint32_t periodMs) {
    if (id == 0 || window == nullptr) {
        return 0;
    }
    return ::SetTimer(Hwnd(window), id, periodMs, nullptr);
}

bool KillTimer(WindowHandle window, uintptr_t id) {
    return window != nullptr && ::KillTimer(Hwnd(window), id) != FALSE;
}

int MessageQueueDescriptor() {
    // The thread's own Windows message queue is the source: a host waits for it with
    // MsgWaitForMultipleObjects and pumps it with its own loop. There is no handle to give.
    return -1;
}

int PumpPendingMessages() {
    return PumpImpl(nullptr);
}

bool RunMessageLoopUntil(const std::function<bool()>& done, int timeoutMs) {
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
        if (t_quit) {
            t_quit = false;
            return false;
        }
        if (InterruptPending()) {
            return done();
        }
        DWORD wait = INFINITE;
        if (timeoutMs >= 0) {
            const uint64_t now = GetTickCount64();
            if (now >= deadline) {
                return false;
            }
            wait = static_cast<DWORD>(deadline - now);
        }
        std::vector<HANDLE> handles = t_watched;
        const StopSource* stop = CurrentStopSource();
        if (stop != nullptr && stop->Descriptor() >= 0) {
            handles.push_back(HandleOf(stop->Descriptor()));
        }
        if (HANDLE e = g_interrupt.load()) {
            handles.push_back(e);
        }
        const DWORD r =
            MsgWaitForMultipleObjectsEx(static_cast<DWORD>(handles.size()), handles.data(), wait,
                                        QS_ALLINPUT, MWMO_INPUTAVAILABLE);
        if (r == WAIT_FAILED) {
            return done();
        }
        if (stop != nullptr && stop->StopRequested()) {
            return done();
        }
    }
}

void RunMessageLoop() {
    RunMessageLoopUntil([] { return false; }, -1);
}

void QuitMessageLoop() {
    t_quit = true;
}

bool RouteInterruptsToMessageLoop() {
    static HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    if (event == nullptr) {
        return false;
    }
    g_interrupt.store(event);
    return SetConsoleCtrlHandler(ConsoleControl, TRUE) != FALSE;
}

bool WatchInMessageLoop(int fd) {
    if (fd < 0) {
        return false;
    }
    for (HANDLE h : t_watched) {
        if (h == HandleOf(fd)) {
            return true;
        }
    }
    if (t_watched.size() + 2 >= MAXIMUM_WAIT_OBJECTS) {
        return false;
    }
    t_watched.push_back(HandleOf(fd));
    return true;
}

bool InterruptRequested() {
    return InterruptPending();
}

}  // namespace platform
