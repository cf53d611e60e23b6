// The client's view of the calling thread's message loop.
#include <nqportmanager/messageloop.h>

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

}  // extern "C"
