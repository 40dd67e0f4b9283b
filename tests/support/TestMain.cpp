// GoogleTest main for every test executable: a QCoreApplication exists for the whole run,
// on the main thread, so tests can use event loops, timers and queued connections.
#include <QCoreApplication>
#include <gtest/gtest.h>

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv);
    ::testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
