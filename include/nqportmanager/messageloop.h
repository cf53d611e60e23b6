// The message loop of the calling thread. Every object of the module created on a thread posts
// to that thread's queue: discovery outcomes, keep-alive timers and events arrive through it, so
// the thread must pump it: run the loop, or watch NqMessageQueueDescriptor() in the host's own
// loop (GLib, Qt, libuv, epoll) and call NqPumpPendingMessages() when it is readable.
#pragma once

#include <nqportmanager/comtypes.h>

#include <cstddef>

extern "C" {
// Readable while a message is queued or a timer is due for this thread.
NQ_MODULE_EXPORT int NqMessageQueueDescriptor();
// Delivers what is queued and due now; the number of messages delivered.
NQ_MODULE_EXPORT int NqPumpPendingMessages();
// Pumps until done(context) is non-zero (asked after every message) or timeoutMs passes (-1:
// no limit). Returns the last answer of done.
NQ_MODULE_EXPORT int NqRunMessageLoopUntil(int (*done)(void* context), void* context,
                                           int timeoutMs);
// Pumps until NqQuitMessageLoop() is called on this thread.
NQ_MODULE_EXPORT void NqRunMessageLoop();
NQ_MODULE_EXPORT void NqQuitMessageLoop();

// Where the module's debugger output goes (the logger's lines, as Windows sends them to
// OutputDebugString): to sink, called on the logging thread with one line and its length; null
// discards it, as without a debugger.
NQ_MODULE_EXPORT void NqSetDebugOutputSink(void (*sink)(const char* line, size_t length,
                                                        void* context),
                                           void* context);
}  // extern "C"
