// The file of a reply: what happens when it cannot be read, and who closes it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "protocol/replytools.h"

namespace {

TEST(OxReply, ReadErrorOnTheFirstBlockSendsNothing) {
    const int directory = ::open("/", O_RDONLY | O_CLOEXEC);
    ASSERT_GT(directory, 0);
    oxReply reply(Http::OK_200, Http::TYPE_HTML, directory, 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ("", sent.text);
    EXPECT_EQ(std::vector<std::string>{"Reply error reading file - handle = " + std::to_string(directory)}, sent.lines);
    EXPECT_FALSE(IsOpen(directory));
}

TEST(OxReply, ReadErrorOnALaterBlockEndsTheReply) {
    // The first send takes what the next read needs: the descriptor turns into a directory.
    static int file;
    static int calls;
    file = FileOf(std::string(100000, 'x'));
    calls = 0;
    const SendStub stub([](int socket, const void* data, size_t size, int flags) {
        if (++calls == 1) {
            const UniqueFd directory(::open("/", O_RDONLY | O_CLOEXEC));
            EXPECT_EQ(file, ::dup3(directory.Get(), file, O_CLOEXEC));
        }
        return ::send(socket, data, size, flags);
    });
    oxReply reply(Http::OK_200, Http::TYPE_NONE, file, 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ(OkHeader("") + std::string(20480, 'x'), sent.text);
    EXPECT_EQ(std::vector<std::string>{"Reply error reading file - handle = " + std::to_string(file)}, sent.lines);
    EXPECT_EQ(20480u, sent.bytes);
    EXPECT_EQ(2, calls) << "the header and the first block";
    EXPECT_FALSE(IsOpen(file));
}

TEST(OxReply, DestructorClosesAnUnsentFile) {
    const int file = FileOf("x");
    { const oxReply reply(Http::OK_200, Http::TYPE_HTML, file, 0, nullptr); }
    EXPECT_FALSE(IsOpen(file));
}

TEST(OxReply, ErrorStatusNeverReadsItsFile) {
    const int file = FileOf("x");
    {
        oxReply reply(Http::FORBIDDEN_403, Http::TYPE_HTML, file, 0, nullptr);
        EXPECT_EQ(reply.ComposeHeader(), Send(reply).text);
        EXPECT_EQ(0, ::lseek(file, 0, SEEK_CUR));
    }
    EXPECT_FALSE(IsOpen(file));
}

TEST(OxReply, HandleZeroIsNeverClosed) {
    // Descriptor 0 is put back afterwards, closed if it was.
    const UniqueFd kept(::fcntl(0, F_DUPFD_CLOEXEC, 3));
    const UniqueFd file(FileOf("x"));
    ASSERT_EQ(0, ::dup2(file.Get(), 0));
    {
        oxReply reply(Http::OK_200, Http::TYPE_HTML, 0, 0, nullptr);
        reply.CloseFile();
    }
    EXPECT_TRUE(IsOpen(0));
    kept ? ::dup2(kept.Get(), 0) : ::close(0);
}

TEST(OxReply, HandleZeroIsSentAndStaysOpen) {
    const std::string body(30000, 'z');
    const UniqueFd file(FileOf(body));
    // In a process of its own: the test's standard input stays what it is.
    Connection connection;
    std::fflush(nullptr);
    const pid_t child = ::fork();
    if (child == 0) {
        LineLog log;
        ManualClock clock;
        oxTimeStamp stamp(clock);
        bool good = ::dup2(file.Get(), 0) == 0;
        {
            oxReply reply(Http::OK_200, Http::TYPE_NONE, 0, 0, nullptr);
            reply.SetClock(clock);
            reply.Send(connection.Server(), stamp, log);
            good = good && reply.GetBytesSent() == 30000 && log.Lines().empty() && IsOpen(0);
            reply.CloseFile();
        }
        ::_exit(good && IsOpen(0) && ::lseek(0, 0, SEEK_CUR) == 30000 ? 0 : 1);
    }
    ASSERT_GT(child, 0);
    connection.Server().Close();
    EXPECT_EQ(OkHeader("") + body, connection.PeerReadAll());
    int status = -1;
    ASSERT_EQ(child, ::waitpid(child, &status, 0));
    EXPECT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
}

}  // namespace
