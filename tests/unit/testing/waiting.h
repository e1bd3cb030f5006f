// Waiting for a condition instead of sleeping.
#pragma once

#include <chrono>
#include <functional>
#include <thread>

// True as soon as the condition holds; false when it does not within a time that is generous for slow builds.
inline bool Eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds limit = std::chrono::seconds(20)) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (!condition()) {
        if (std::chrono::steady_clock::now() >= end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}
