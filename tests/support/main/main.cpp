// The main of every test executable: GoogleTest with the leak check around each test.
#include <gtest/gtest.h>

#include "platform/message.h"
#include "tests/support/LeakCheck.h"

int main(int argc, char** argv) {
    ::testing::InitGoogleTest(&argc, argv);
    // The main thread's message queue lives as long as the thread: made before the first test.
    platform::MessageQueueDescriptor();
    ::testing::UnitTest::GetInstance()->listeners().Append(new testsupport::LeakCheck);
    return RUN_ALL_TESTS();
}
