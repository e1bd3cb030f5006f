// The narrow thing that lower layers report a failure to.
#pragma once

// Takes one error line. The message log of the server is one; tests bring their own. Any thread may call it.
class oxErrorSink {
public:
    virtual void Error(const char* format, ...) __attribute__((format(printf, 2, 3))) = 0;

protected:
    ~oxErrorSink() = default;
};
