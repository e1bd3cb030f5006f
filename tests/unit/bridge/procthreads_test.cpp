// Many threads that start programs at once.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "bridge/proctools.h"

namespace {

constexpr int STARTS = 10000;  // by all threads together
constexpr int STARTS_IN_A_SLOW_BUILD = 1000;
constexpr std::uint32_t LONGEST_RUN = 60000;  // milliseconds: a child takes two

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool SLOW_BUILD = true;
#elif defined(__has_feature)
constexpr bool SLOW_BUILD = __has_feature(address_sanitizer) || __has_feature(thread_sanitizer);
#else
constexpr bool SLOW_BUILD = false;
#endif

class OxProcThreads : public testing::TestWithParam<int> {};

std::string Words(int thread, int round) {
    std::string words = "thread" + std::to_string(thread) + " round" + std::to_string(round);
    // Texts of different lengths, so that one written over another would show.
    for (int word = 0; word < (thread + round) % 8; ++word)
        words += " " + std::string(static_cast<std::size_t>(round % 50 + 1), static_cast<char>('a' + thread));
    return words;
}

}  // namespace

TEST_P(OxProcThreads, EveryChildGetsItsOwnArgumentsAndNoneHangs) {
    const int threads = GetParam();
    const int rounds = (SLOW_BUILD ? STARTS_IN_A_SLOW_BUILD : STARTS) / threads;
    std::atomic<int> started{0};
    std::atomic<int> mixed{0};
    std::atomic<int> hung{0};
    std::vector<std::jthread> starters;
    for (int thread = 0; thread < threads; ++thread)
        starters.emplace_back([&, thread] {
            oxProc proc;
            for (int round = 0; round < rounds && hung == 0; ++round) {
                const std::string words = Words(thread, round);
                TestPipe pipe;
                proc.m_childStdout = pipe.writeEnd.Release();
                started += proc.Spawn("/bin/echo", words.c_str()) != 0;
                const int result = proc.Wait(LONGEST_RUN);
                if (result == oxProc::STILL_RUNNING) {
                    ++hung;
                    proc.Kill();
                    proc.Wait(oxProc::NO_LIMIT);
                } else {
                    mixed += result != 0 || pipe.ReadAll() != words + "\n";
                }
            }
        });
    starters.clear();
    EXPECT_EQ(0, hung.load());
    EXPECT_EQ(0, mixed.load());
    EXPECT_EQ(threads * rounds, started.load());
}

INSTANTIATE_TEST_SUITE_P(Of, OxProcThreads, testing::Values(2, 16));
