#include "support/auditfile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <regex>
#include <thread>
#include <vector>

#include "testing/scratch.h"

namespace {

const std::string STAMP = "(Jan|Feb|Mar|Apr|May|Jun|Jul|Aug|Sep|Oct|Nov|Dec)-\\d{2}-\\d{4} \\d{2}:\\d{2}:\\d{2}: ";

testing::AssertionResult Stamped(const std::string& line, const std::string& text) {
    std::smatch match;
    if (!std::regex_search(line, match, std::regex("^" + STAMP)))
        return testing::AssertionFailure() << "no time stamp: " << line;
    if (match.suffix().str() != text)
        return testing::AssertionFailure() << "text is: " << match.suffix().str();
    return testing::AssertionSuccess();
}

// Standard error, kept aside while a test lets a log take it over.
class StderrKeeper {
public:
    StderrKeeper() : m_kept(fcntl(2, F_DUPFD_CLOEXEC, 3)) {}
    ~StderrKeeper() {
        dup2(m_kept, 2);
        close(m_kept);
    }
    StderrKeeper(const StderrKeeper&) = delete;
    StderrKeeper& operator=(const StderrKeeper&) = delete;

private:
    int m_kept;
};

TEST(oxAuditFile, NewObjectHasTheDefaultLevelAndIsClosed) {
    oxAuditFile log;
    EXPECT_EQ(log.GetDebugLevel(), oxAuditFile::GetDefaultDebugLevel());
    EXPECT_FALSE(log.IsOpen());
    EXPECT_STREQ(log.GetPath(), "");
    log.Printf("dropped");
}

TEST(oxAuditFile, WritesStampedLines) {
    Scratch dir;
    oxAuditFile log;
    ASSERT_TRUE(log.Open(dir.File("a.log").c_str(), "a"));
    EXPECT_TRUE(log.IsOpen());
    EXPECT_EQ(log.GetPath(), dir.File("a.log"));
    log.Printf("Process %d cancelled", 7);
    log.Write("plain", 1);
    log.Close();
    EXPECT_FALSE(log.IsOpen());
    const auto lines = dir.Lines("a.log");
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_TRUE(Stamped(lines[0], "Process 7 cancelled"));
    EXPECT_TRUE(Stamped(lines[1], "plain"));
}

TEST(oxAuditFile, LevelDecidesWhatIsWritten) {
    struct Case {
        int level;
        int message;
        bool written;
    };
    for (const Case& c : {Case{1, 1, true},
                          {1, 2, false},
                          {5, 5, true},
                          {5, 7, false},
                          {9, 9, true},
                          {0, 0, false},
                          {0, 1, false},
                          {0, -1, false},
                          {1, 0, true},
                          {10, 10, true},
                          {-1, -2, true},
                          {-1, -1, true},
                          {-1, 0, false},
                          {-1, 1, false}}) {
        Scratch dir;
        oxAuditFile log(dir.File("l.log").c_str(), "a");
        log.SetDebugLevel(c.level);
        const std::size_t before = dir.Lines("l.log").size();
        log.Printf(c.message, "formatted");
        log.Write("plain", c.message);
        EXPECT_EQ(dir.Lines("l.log").size(), before + (c.written ? 2 : 0)) << c.level << " " << c.message;
    }
}

TEST(oxAuditFile, OnlyLevelZeroSilencesUnconditionalLines) {
    for (const int level : {-9, -1, 0, 1, 9}) {
        Scratch dir;
        oxAuditFile log(dir.File("z.log").c_str(), "a");
        log.SetDebugLevel(level);
        const std::size_t before = dir.Lines("z.log").size();
        log.Printf("unconditional");
        EXPECT_EQ(dir.Lines("z.log").size(), before + (level == 0 ? 0 : 1)) << level;
    }
}

TEST(oxAuditFile, SetDebugLevelWritesItsLineAtLevelNine) {
    Scratch dir;
    oxAuditFile log(dir.File("d.log").c_str(), "a");
    log.SetDebugLevel(8);
    EXPECT_EQ(dir.Read("d.log"), "");
    log.SetDebugLevel(9);
    const auto lines = dir.Lines("d.log");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_TRUE(Stamped(lines[0], "Debug level is now 9."));
}

TEST(oxAuditFile, NewlineAtTheEndIsNotDoubledInTheFileButShowsOnTheEcho) {
    Scratch dir;
    oxAuditFile log(dir.File("n.log").c_str(), "a");
    std::FILE* echo = std::fopen(dir.File("echo").c_str(), "w");
    log.SetEcho(echo);
    log.Write("one\n", 1);
    log.Printf("two\n");
    log.Printf("three");
    log.Close();
    std::fclose(echo);
    const auto lines = dir.Lines("n.log");
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_TRUE(Stamped(lines[0], "one"));
    EXPECT_TRUE(Stamped(lines[1], "two"));
    EXPECT_TRUE(Stamped(lines[2], "three"));
    EXPECT_EQ(dir.Read("echo"), "one\n\ntwo\n\nthree\n");
}

TEST(oxAuditFile, CloseForgetsTheEcho) {
    Scratch dir;
    std::FILE* echo = std::fopen(dir.File("echo").c_str(), "w");
    oxAuditFile log(dir.File("e.log").c_str(), "a");
    log.SetEcho(echo);
    log.Close();
    ASSERT_TRUE(log.Open(dir.File("e.log").c_str(), "a"));
    log.Printf("not echoed");
    std::fclose(echo);
    EXPECT_EQ(dir.Read("echo"), "");
}

TEST(oxAuditFile, LongTextIsCutAt4095Characters) {
    Scratch dir;
    oxAuditFile log(dir.File("c.log").c_str(), "a");
    const std::string text(9000, 'x');
    log.Printf("%s", text.c_str());
    const auto lines = dir.Lines("c.log");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_TRUE(Stamped(lines[0], std::string(4095, 'x')));
}

TEST(oxAuditFile, WrittenTextIsNotCut) {
    Scratch dir;
    oxAuditFile log(dir.File("w.log").c_str(), "a");
    const std::string text(40000, 'y');
    log.Write(text.c_str(), 1);
    EXPECT_TRUE(Stamped(dir.Lines("w.log").at(0), text));
}

TEST(oxAuditFile, BareNameGoesToTheDefaultDirectory) {
    Scratch dir;
    const std::string before = oxAuditFile::GetDefaultPath();
    oxAuditFile::SetDefaultPath(dir.Path().c_str());
    oxAuditFile log;
    ASSERT_TRUE(log.Open("bare.log", "a"));
    EXPECT_EQ(log.GetPath(), std::string(oxAuditFile::GetDefaultPath()) + "/bare.log");
    log.Printf("here");
    EXPECT_EQ(dir.Lines("bare.log").size(), 1u);
    oxAuditFile::SetDefaultPath(before.c_str());
}

TEST(oxAuditFile, DefaultDirectoryIsStoredResolvedWhereItExists) {
    Scratch dir;
    const std::string before = oxAuditFile::GetDefaultPath();
    oxAuditFile::SetDefaultPath((dir.Path() + "/./").c_str());
    EXPECT_EQ(oxAuditFile::GetDefaultPath(), std::filesystem::canonical(dir.Path()).string());
    oxAuditFile::SetDefaultPath("/no/such/directory");
    EXPECT_STREQ(oxAuditFile::GetDefaultPath(), "/no/such/directory");
    oxAuditFile::SetDefaultPath(std::string(5000, 'd').c_str());
    EXPECT_EQ(std::string(oxAuditFile::GetDefaultPath()).size(), 4094u);
    oxAuditFile::SetDefaultPath(before.c_str());
}

TEST(oxAuditFile, ModesAppendOrStartAfresh) {
    struct Case {
        const char* mode;
        std::size_t lines;
    };
    for (const Case& c : {Case{"a", 2}, {"a+", 2}, {"w+", 1}, {"w", 1}}) {
        Scratch dir;
        dir.Write("m.log", "old\n");
        oxAuditFile log(dir.File("m.log").c_str(), c.mode);
        log.Printf("new");
        EXPECT_EQ(dir.Lines("m.log").size(), c.lines) << c.mode;
    }
}

TEST(oxAuditFile, FilesAreNotWorldWritableUnderAnEmptyMask) {
    Scratch dir;
    const mode_t before = umask(0);
    oxAuditFile log(dir.File("mode.log").c_str(), "a");
    umask(before);
    struct stat status {};
    ASSERT_EQ(stat(dir.File("mode.log").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777u, 0644u);
    EXPECT_EQ(fcntl(fileno(log.GetStream()), F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
}

TEST(oxAuditFile, FailedOpenIsTriedThreeTimesAndReported) {
    Scratch dir;
    oxAuditFile log;
    testing::internal::CaptureStderr();
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_FALSE(log.Open(dir.File("none/x.log").c_str(), "a"));
    const auto took = std::chrono::steady_clock::now() - begin;
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "oxAuditFile error: No such file or directory\n");
    EXPECT_GE(took, std::chrono::milliseconds(2900));
    EXPECT_FALSE(log.IsOpen());
}

TEST(oxAuditFile, FailingOpenDelaysNoOtherLog) {
    Scratch dir;
    oxAuditFile good(dir.File("good.log").c_str(), "a");
    testing::internal::CaptureStderr();
    std::thread failing([&] {
        oxAuditFile bad;
        bad.Open(dir.File("none/x.log").c_str(), "a");
    });
    std::chrono::steady_clock::duration longest{};
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
    while (std::chrono::steady_clock::now() < end) {
        const auto begin = std::chrono::steady_clock::now();
        good.Printf("line");
        longest = std::max(longest, std::chrono::steady_clock::now() - begin);
    }
    failing.join();
    testing::internal::GetCapturedStderr();
    EXPECT_LT(longest, std::chrono::milliseconds(900));
}

TEST(oxAuditFile, TakesOverStandardError) {
    Scratch dir;
    {
        const StderrKeeper keeper;
        oxAuditFile log;
        ASSERT_TRUE(log.Open(dir.File("status.log").c_str(), "a+", stderr));
        EXPECT_FALSE(log.IsOpen());  // standard error does not count as open
        log.Printf("line");
        std::fputs("from elsewhere\n", stderr);
        log.Close();
        std::fputs("still there\n", stderr);  // closing leaves standard error open
    }
    const auto lines = dir.Lines("status.log");
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_TRUE(Stamped(lines[0], "line"));
    EXPECT_EQ(lines[1], "from elsewhere");
    EXPECT_EQ(lines[2], "still there");
}

TEST(oxAuditFile, FailedTakeoverLeavesStandardErrorAsItWas) {
    Scratch dir;
    {
        const StderrKeeper keeper;
        const int file = open(dir.File("stderr").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
        dup2(file, 2);
        close(file);
        oxAuditFile log;
        EXPECT_FALSE(log.Open(dir.File("none/status.log").c_str(), "a+", stderr));
        log.Printf("dropped");
        std::fputs("mine\n", stderr);
    }
    EXPECT_EQ(dir.Read("stderr"), "oxAuditFile error: No such file or directory\nmine\n");
}

TEST(oxAuditFile, TakesOverAClosedStandardError) {
    Scratch dir;
    {
        const StderrKeeper keeper;
        close(2);
        oxAuditFile log;
        ASSERT_TRUE(log.Open(dir.File("status.log").c_str(), "a+", stderr));
        EXPECT_EQ(fcntl(2, F_GETFD), 0);  // children are to have it
        log.Printf("line");
    }
    EXPECT_EQ(dir.Lines("status.log").size(), 1u);
}

TEST(oxAuditFile, ReopeningClosesTheFormerFile) {
    Scratch dir;
    oxAuditFile log(dir.File("first").c_str(), "a");
    ASSERT_TRUE(log.Open(dir.File("second").c_str(), "a"));
    log.Printf("line");
    EXPECT_EQ(dir.Read("first"), "");
    EXPECT_EQ(dir.Lines("second").size(), 1u);
}

TEST(oxAuditFile, CopySharesTheStreamAndLeavesItToTheOriginal) {
    Scratch dir;
    oxAuditFile log(dir.File("copy.log").c_str(), "a");
    log.SetDebugLevel(5);
    {
        oxAuditFile copy(log);
        EXPECT_STREQ(copy.GetPath(), log.GetPath());
        EXPECT_EQ(copy.GetDebugLevel(), 5);
        copy.Printf("by the copy");
    }
    oxAuditFile assigned;
    assigned = log;
    assigned.Printf("by the assigned");
    assigned.Close();
    log.Printf("by the original");
    EXPECT_EQ(dir.Lines("copy.log").size(), 3u);
}

TEST(oxAuditFile, AttachUsesTheGivenStream) {
    Scratch dir;
    oxAuditFile log(dir.File("before").c_str(), "a");
    log.Attach(std::fopen(dir.File("after").c_str(), "w"));
    log.Printf("line");
    EXPECT_EQ(dir.Read("before"), "");
    EXPECT_EQ(dir.Lines("after").size(), 1u);
}

TEST(oxAuditFile, LinesOfManyThreadsAndFilesStayWhole) {
    constexpr int THREADS = 8;
    constexpr int LINES = 2000;
    Scratch dir;
    oxAuditFile first(dir.File("t.log").c_str(), "a");
    oxAuditFile second(dir.File("t.log").c_str(), "a");
    std::vector<std::thread> threads;
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < LINES; ++i)
                (t % 2 ? first : second).Printf("%d %s", t, std::string(100, static_cast<char>('a' + t)).c_str());
        });
    }
    for (auto& thread : threads)
        thread.join();
    const auto lines = dir.Lines("t.log");
    ASSERT_EQ(lines.size(), static_cast<std::size_t>(THREADS * LINES));
    int counts[THREADS] = {};
    for (const auto& line : lines) {
        const std::string text = line.substr(line.find(": ") + 2);
        const int t = text.at(0) - '0';
        ASSERT_TRUE(t >= 0 && t < THREADS && text.substr(2) == std::string(100, static_cast<char>('a' + t))) << line;
        ++counts[t];
    }
    for (const int count : counts)
        EXPECT_EQ(count, LINES);
}

TEST(oxAuditFile, HandlerLineIsStampedAndGivenUpWhenTheLockStaysTaken) {
    // A log whose stamp writes from a handler stands for a failure inside a locked operation.
    class Reentrant : public oxAuditFile {
    public:
        const char* Stamp() override {
            if (!m_inside) {
                m_inside = true;
                WriteFromHandler("lost");
                m_inside = false;
            }
            return oxAuditFile::Stamp();
        }
        bool m_inside = false;
    };
    Scratch dir;
    Reentrant log;
    ASSERT_TRUE(log.Open(dir.File("h.log").c_str(), "a"));
    log.Printf("line");
    log.m_inside = true;
    log.WriteFromHandler("Memory allocation failed.");
    const auto lines = dir.Lines("h.log");
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_TRUE(Stamped(lines[0], "line"));
    EXPECT_TRUE(Stamped(lines[1], "Memory allocation failed."));
}

}  // namespace
