// Where a log file is opened, and what becomes of the one that was open.
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <string>
#include <thread>

#include "support/auditfile.h"
#include "testing/scratch.h"

namespace {

namespace fs = std::filesystem;

// The default directory and the working directory, put back when the test ends.
class PlacesKeeper {
public:
    PlacesKeeper() : m_default(oxAuditFile::GetDefaultPath()), m_working(fs::current_path()) {}
    ~PlacesKeeper() {
        oxAuditFile::SetDefaultPath(m_default.c_str());
        fs::current_path(m_working);
    }
    PlacesKeeper(const PlacesKeeper&) = delete;
    PlacesKeeper& operator=(const PlacesKeeper&) = delete;

private:
    std::string m_default;
    fs::path m_working;
};

using std::chrono::milliseconds;
using std::chrono::steady_clock;

struct Opening {
    bool opened;
    milliseconds took;
};

// Opens a log in a directory that is made that long after the open began.
Opening OpenIn(milliseconds directoryAfter) {
    const Scratch dir;
    oxAuditFile log;
    testing::internal::CaptureStderr();
    const auto begin = steady_clock::now();
    std::jthread maker([&] {
        std::this_thread::sleep_until(begin + directoryAfter);
        fs::create_directory(dir.File("late"));
    });
    const bool opened = log.Open(dir.File("late/x.log").c_str(), "a");
    const auto took = std::chrono::ceil<milliseconds>(steady_clock::now() - begin);
    testing::internal::GetCapturedStderr();
    return {opened, took};
}

// A machine that is busy may hold up either side; a rule that is broken fails each time.
constexpr int REPEATS = 5;

TEST(oxAuditFile, ADirectoryThatAppearsBeforeTheThirdTryIsInTime) {
    bool opened = false;
    for (int i = 0; i < REPEATS && !opened; ++i)
        opened = OpenIn(milliseconds(1300)).opened;
    EXPECT_TRUE(opened);
}

TEST(oxAuditFile, ADirectoryThatAppearsBehindTheThirdTryIsTooLate) {
    bool refused = false;
    for (int i = 0; i < REPEATS && !refused; ++i) {
        const Opening opening = OpenIn(milliseconds(2500));
        refused = !opening.opened && opening.took < milliseconds(3900);
    }
    EXPECT_TRUE(refused);
}

TEST(oxAuditFile, AStreamIsRedirectedInOneTry) {
    const Scratch dir;
    milliseconds shortest = milliseconds::max();
    for (int i = 0; i < REPEATS && shortest > milliseconds(900); ++i) {
        std::FILE* stream = std::fopen(dir.File("before").c_str(), "a");
        ASSERT_NE(stream, nullptr);
        oxAuditFile log;
        testing::internal::CaptureStderr();
        const auto begin = steady_clock::now();
        EXPECT_FALSE(log.Open(dir.File("none/x.log").c_str(), "a", stream));
        shortest = std::min(shortest, std::chrono::ceil<milliseconds>(steady_clock::now() - begin));
        EXPECT_EQ(testing::internal::GetCapturedStderr(), "oxAuditFile error: No such file or directory\n");
        std::fclose(stream);
    }
    EXPECT_LT(shortest, milliseconds(900));
}

TEST(oxAuditFile, AnEmptyDefaultDirectoryBecomesTheAbsoluteWorkingDirectory) {
    const Scratch dir;
    const std::string real = fs::canonical(dir.Path()).string();
    fs::create_directory(dir.File("real"));
    fs::create_directory_symlink("real", dir.File("link"));
    const PlacesKeeper keeper;
    oxAuditFile::SetDefaultPath("");
    ASSERT_STREQ(oxAuditFile::GetDefaultPath(), "");
    fs::current_path(dir.File("link"));

    oxAuditFile log;
    ASSERT_TRUE(log.Open("bare.log", "a"));
    EXPECT_EQ(log.GetPath(), real + "/real/bare.log");
    EXPECT_EQ(oxAuditFile::GetDefaultPath(), real + "/real");
    log.Printf("here");
    EXPECT_EQ(dir.Lines("real/bare.log").size(), 1u);

    fs::current_path(dir.Path());
    oxAuditFile second;
    ASSERT_TRUE(second.Open("second.log", "a"));
    EXPECT_EQ(second.GetPath(), real + "/real/second.log") << "the first directory stays the default";
    EXPECT_TRUE(fs::exists(dir.File("real/second.log")));
    EXPECT_FALSE(fs::exists(dir.File("second.log")));
}

TEST(oxAuditFile, ANameWithADirectoryIsTakenAsItIsAndStillSettlesTheDefault) {
    const Scratch dir;
    const PlacesKeeper keeper;
    oxAuditFile::SetDefaultPath("");
    fs::current_path(dir.Path());
    oxAuditFile log;
    ASSERT_TRUE(log.Open("./named.log", "a"));
    EXPECT_STREQ(log.GetPath(), "./named.log");
    EXPECT_TRUE(fs::exists(dir.File("named.log")));
    EXPECT_EQ(oxAuditFile::GetDefaultPath(), fs::canonical(dir.Path()).string());
}

TEST(oxAuditFile, OpeningAnOpenObjectGoesThroughItsOwnClose) {
    class Closing : public oxAuditFile {
    public:
        void Close() override {
            ++closes;
            oxAuditFile::Close();
        }
        int closes = 0;
    };
    const Scratch dir;
    Closing log;
    ASSERT_TRUE(log.Open(dir.File("first").c_str(), "a"));
    EXPECT_EQ(log.closes, 0) << "nothing was open";
    log.Printf("one");
    ASSERT_TRUE(log.Open(dir.File("second").c_str(), "a"));
    EXPECT_EQ(log.closes, 1);
    log.Printf("two");
    EXPECT_EQ(dir.Lines("first").size(), 1u);
    EXPECT_EQ(dir.Lines("second").size(), 1u);
}

TEST(oxAuditFile, ErrorReportsAndClearsTheErrorStateOfTheStream) {
    const Scratch dir;
    oxAuditFile log;
    log.Attach(std::fopen(dir.Write("readable", "text").c_str(), "r"));
    ASSERT_NE(log.GetStream(), nullptr);
    ASSERT_EQ(std::fputc('x', log.GetStream()), EOF);
    ASSERT_NE(std::ferror(log.GetStream()), 0);
    testing::internal::CaptureStderr();
    log.Error(EIO);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "oxAuditFile error: Input/output error\n");
    EXPECT_EQ(std::ferror(log.GetStream()), 0);
}

TEST(oxAuditFile, ErrorOfAnObjectWithoutAStreamIsOnlyReported) {
    oxAuditFile log;
    testing::internal::CaptureStderr();
    log.Error(ENOSPC);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "oxAuditFile error: No space left on device\n");
}

}  // namespace
