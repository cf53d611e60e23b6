// The client's view of the calling thread's message loop, and of the module's debugger output.
#include <nqportmanager/messageloop.h>

#include <string_view>

#include "platform/kernel.h"
#include "platform/message.h"

extern "C" {

int NqMessageQueueDescriptor() {
    return platform::MessageQueueDescriptor();
}

int NqPumpPendingMessages() {
    return platform::PumpPendingMessages();
}

int NqRunMessageLoopUntil(int (*done)(void* context), void* context, int timeoutMs) {
    if (done == nullptr) {
        return 0;
    }
    return platform::RunMessageLoopUntil([&] { return done(context) != 0; }, timeoutMs) ? 1 : 0;
}

void NqRunMessageLoop() {
    platform::RunMessageLoop();
}

void NqQuitMessageLoop() {
    platform::QuitMessageLoop();
}

void NqSetDebugOutputSink(void (*sink)(const char* line, size_t length, void* context),
                          void* context) {
    if (sink == nullptr) {
        platform::SetDebugOutputSink(nullptr);
        return;
    }
    platform::SetDebugOutputSink(
        [sink, context](std::string_view line) { sink(line.data(), line.size(), context); });
}

}  // extern "C"
