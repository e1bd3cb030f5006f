// Threads that cannot be started, for tests. The test program is linked so that its thread starts pass through here.
#pragma once

// While it lives, every attempt to start a thread fails with the error number.
class FailingThreads {
public:
    explicit FailingThreads(int error);
    ~FailingThreads() { End(); }
    FailingThreads(const FailingThreads&) = delete;
    FailingThreads& operator=(const FailingThreads&) = delete;
    void End();
};
