// The main of every test executable: GoogleTest with the leak check around each test.
#include <gtest/gtest.h>

#include <thread>

#include "platform/message.h"
#include "tests/support/LeakCheck.h"

int main(int argc, char** argv) {
    ::testing::InitGoogleTest(&argc, argv);
    // The main thread's message queue lives as long as the thread: made before the first test.
    platform::MessageQueueDescriptor();
    // A sanitizer's own helper thread starts with the first thread: made here, not in a test.
    std::thread([] {}).join();
    ::testing::UnitTest::GetInstance()->listeners().Append(new testsupport::LeakCheck);
    return RUN_ALL_TESTS();
}
