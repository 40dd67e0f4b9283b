#pragma once
// Waiting in tests. Every limit is scaled for instrumented builds, which run several times slower,
// so that a slow build is never mistaken for a hang; waits keep the calling thread's event loop
// turning, so queued replies and timers of the main thread are delivered while they wait.

#include <QCoreApplication>
#include <QElapsedTimer>
#include <QThread>

#include <functional>

#ifndef DELVIX_TEST_TIME_SCALE
#define DELVIX_TEST_TIME_SCALE 1
#endif

constexpr int kTimeScale = DELVIX_TEST_TIME_SCALE;

// A limit in milliseconds for this build.
constexpr int scaledMs(int ms)
{
    return ms * kTimeScale;
}

// Waits until `condition` holds or `limitMs` (scaled) has passed; says whether it holds.
inline bool waitFor(const std::function<bool()>& condition, int limitMs = 10000)
{
    QElapsedTimer timer;
    timer.start();
    while (!condition()) {
        if (timer.elapsed() >= scaledMs(limitMs)) {
            return condition();
        }
        QCoreApplication::processEvents(QEventLoop::AllEvents, 5);
        QThread::msleep(1);
    }
    return true;
}
