#include "platform/file.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string>
#include <thread>

#include "testing/scratch.h"

namespace {

bool IsOpenDescriptor(int descriptor) {
    return fcntl(descriptor, F_GETFD) != -1;
}

mode_t ModeOf(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

// Ends the program when what follows hangs.
class AlarmAfter {
public:
    explicit AlarmAfter(unsigned seconds) { alarm(seconds); }
    ~AlarmAfter() { alarm(0); }
    AlarmAfter(const AlarmAfter&) = delete;
    AlarmAfter& operator=(const AlarmAfter&) = delete;
};

class UmaskFor {
public:
    explicit UmaskFor(mode_t mask) : m_before(umask(mask)) {}
    ~UmaskFor() { umask(m_before); }
    UmaskFor(const UmaskFor&) = delete;
    UmaskFor& operator=(const UmaskFor&) = delete;

private:
    mode_t m_before;
};

}  // namespace

TEST(UniqueFd, ClosesWhatItOwnsAndKeepsErrno) {
    int number = -1;
    {
        const UniqueFd file = OpenFile("/dev/null", O_RDONLY);
        ASSERT_TRUE(file);
        number = file.Get();
        EXPECT_TRUE(IsOpenDescriptor(number));
        errno = ENOTTY;
    }
    EXPECT_EQ(ENOTTY, errno);
    EXPECT_FALSE(IsOpenDescriptor(number));
}

TEST(UniqueFd, MovesReleasesAndResets) {
    UniqueFd first = OpenFile("/dev/null", O_RDONLY);
    UniqueFd second = OpenFile("/dev/null", O_RDONLY);
    const int firstNumber = first.Get();
    const int secondNumber = second.Get();
    first = std::move(second);
    EXPECT_FALSE(IsOpenDescriptor(firstNumber));
    EXPECT_EQ(secondNumber, first.Get());
    EXPECT_FALSE(second);

    UniqueFd& alias = first;
    first = std::move(alias);
    EXPECT_EQ(secondNumber, first.Get());
    first.Reset(secondNumber);
    EXPECT_TRUE(IsOpenDescriptor(secondNumber)) << "its own number is not closed";

    EXPECT_EQ(secondNumber, first.Release());
    EXPECT_FALSE(first);
    EXPECT_TRUE(IsOpenDescriptor(secondNumber));
    UniqueFd(secondNumber).Reset();
    EXPECT_FALSE(IsOpenDescriptor(secondNumber));
}

TEST(OpenFile, IsClosedOnExecAndCreatesWithTheMode) {
    const UmaskFor mask(0);
    const Scratch directory;
    const std::string path = directory.File("new");
    const UniqueFd file = OpenFile(path, O_WRONLY | O_CREAT);
    ASSERT_TRUE(file);
    EXPECT_EQ(FD_CLOEXEC, fcntl(file.Get(), F_GETFD));
    EXPECT_EQ(PRIVATE_FILE_MODE, ModeOf(path));
    const std::string log = directory.File("log");
    EXPECT_TRUE(OpenFile(log, O_WRONLY | O_CREAT, LOG_FILE_MODE));
    EXPECT_EQ(LOG_FILE_MODE, ModeOf(log));
}

TEST(OpenFile, FailureLeavesErrno) {
    const Scratch directory;
    EXPECT_FALSE(OpenFile(directory.File("missing"), O_RDONLY));
    EXPECT_EQ(ENOENT, errno);
}

TEST(ReadWholeFile, GivesEveryByte) {
    const Scratch directory;
    for (const std::size_t size : {0u, 1u, 16383u, 16384u, 16385u, 100000u}) {
        std::string content(size, 'x');
        if (size > 1)
            content[size / 2] = '\0';
        directory.Write("file", content);
        std::string read = "old";
        EXPECT_TRUE(ReadWholeFile(directory.File("file"), read));
        EXPECT_EQ(content, read) << size;
    }
}

TEST(ReadWholeFile, FailsForDirectoriesAndMissingFiles) {
    const Scratch directory;
    std::string content = "old";
    EXPECT_FALSE(ReadWholeFile(directory.Path(), content));
    EXPECT_EQ(EISDIR, errno);
    EXPECT_FALSE(ReadWholeFile(directory.File("missing"), content));
    EXPECT_EQ(ENOENT, errno);
    EXPECT_EQ("", content);
}

TEST(ReadWholeFile, RefusesAPipeAtOnceWithOrWithoutAWriter) {
    const Scratch directory;
    const std::string path = directory.File("pipe");
    ASSERT_EQ(0, mkfifo(path.c_str(), 0600));
    UniqueFd writing;
    for (const bool written : {false, true}) {
        if (written) {
            writing = OpenFile(path, O_RDWR);
            ASSERT_TRUE(writing);
            ASSERT_TRUE(WriteAll(writing.Get(), "text", 4));
        }
        std::string content = "old";
        const AlarmAfter noHanging(20);
        EXPECT_FALSE(ReadWholeFile(path, content)) << written;
        EXPECT_EQ(EINVAL, errno) << written;
        EXPECT_EQ("", content) << written;
    }
}

TEST(ReadWholeFile, RefusesADevice) {
    std::string content = "old";
    EXPECT_FALSE(ReadWholeFile("/dev/zero", content));
    EXPECT_EQ(EINVAL, errno);
    EXPECT_EQ("", content);
}

TEST(DuplicateOnto, MakesAnotherNumberOfTheSameFileWithoutCloseOnExec) {
    const Scratch directory;
    const UniqueFd from = OpenFile(directory.Write("from", "abcdef"), O_RDONLY);
    const UniqueFd to = OpenFile("/dev/null", O_RDONLY);
    ASSERT_TRUE(from);
    ASSERT_TRUE(to);
    ASSERT_EQ(FD_CLOEXEC, fcntl(to.Get(), F_GETFD));
    EXPECT_TRUE(DuplicateOnto(from.Get(), to.Get()));
    EXPECT_EQ(0, fcntl(to.Get(), F_GETFD));
    EXPECT_EQ(FD_CLOEXEC, fcntl(from.Get(), F_GETFD)) << "the first number stays as it was";
    EXPECT_EQ(3, lseek(from.Get(), 3, SEEK_SET));
    char next = 0;
    EXPECT_EQ(1, read(to.Get(), &next, 1));
    EXPECT_EQ('d', next) << "both share one position";
}

TEST(DuplicateOnto, TakesANumberThatIsNotOpen) {
    const UniqueFd from = OpenFile("/dev/null", O_RDONLY);
    int number = -1;
    {
        const UniqueFd free(fcntl(from.Get(), F_DUPFD_CLOEXEC, 100));
        number = free.Get();
    }
    ASSERT_FALSE(IsOpenDescriptor(number));
    ASSERT_TRUE(DuplicateOnto(from.Get(), number));
    const UniqueFd made(number);
    EXPECT_TRUE(IsOpenDescriptor(number));
}

TEST(DuplicateOnto, FailureLeavesErrnoAndTheTargetOpen) {
    const UniqueFd to = OpenFile("/dev/null", O_RDONLY);
    EXPECT_FALSE(DuplicateOnto(-1, to.Get()));
    EXPECT_EQ(EBADF, errno);
    EXPECT_TRUE(IsOpenDescriptor(to.Get()));
    EXPECT_FALSE(DuplicateOnto(to.Get(), -1));
    EXPECT_EQ(EBADF, errno);
}

TEST(WriteAll, WritesThroughShortWrites) {
    std::array<int, 2> ends{-1, -1};
    ASSERT_EQ(0, pipe2(ends.data(), O_CLOEXEC));
    const UniqueFd reading(ends[0]);
    UniqueFd writing(ends[1]);
    const std::string text(300000, 'y');  // more than a pipe holds
    bool written = false;
    std::thread writer([&] {
        written = WriteAll(writing.Get(), text.data(), text.size());
        writing.Reset();
    });
    std::string received;
    std::array<char, 1000> block;
    for (ssize_t count = 0; (count = read(reading.Get(), block.data(), block.size())) > 0;)
        received.append(block.data(), static_cast<std::size_t>(count));
    writer.join();
    EXPECT_TRUE(written);
    EXPECT_EQ(text, received);
}

TEST(WriteAll, FailureLeavesErrno) {
    const UniqueFd full = OpenFile("/dev/full", O_WRONLY);
    ASSERT_TRUE(full);
    EXPECT_TRUE(WriteAll(full.Get(), "", 0));
    EXPECT_FALSE(WriteAll(full.Get(), "x", 1));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_FALSE(WriteAll(-1, "x", 1));
    EXPECT_EQ(EBADF, errno);
}
