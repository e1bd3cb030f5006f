#include "protocol/reply.h"

#include <gtest/gtest.h>
#include <sys/mman.h>

#include <cerrno>
#include <string>
#include <thread>
#include <vector>

#include "protocol/replytools.h"

namespace {

TEST(OxReply, HeaderTable) {
    const struct {
        const char* name;
        const oxHttpStatus& status;
        const oxHttpContentType& type;
        const char* extra;
        std::string expected;
    } cases[] = {
        {"200", Http::OK_200, Http::TYPE_HTML, nullptr, OkHeader("text/html")},
        {"200 without a type", Http::OK_200, Http::TYPE_NONE, "", OkHeader("")},
        {"200 extra headers", Http::OK_200, Http::TYPE_WORD, "A: b\r\nC: d\r\n",
         "HTTP/1.0 200 OK\r\n" + SERVER + ALLOW + "Content-Type: application/msword\r\n" + DATE +
             "A: b\r\nC: d\r\n\r\n"},
        {"200 script output", Http::OK_200, Http::TYPE_DYNAMIC, nullptr,
         "HTTP/1.0 200 OK\r\n" + SERVER + ALLOW +
             "Content-Type: text/html\r\nCache-Control: no-cache\r\nPragma: no-cache\r\n" + DATE + "\r\n"},
        {"200 image", Http::OK_200, Http::TYPE_GIF, "A: b\r\n",
         "HTTP/1.0 200 OK\r\n" + SERVER + ALLOW + "Content-Type: image/gif\r\n" + DATE + EXPIRES + "A: b\r\n\r\n"},
        {"200 other image", Http::OK_200, Http::TYPE_JPG, nullptr,
         "HTTP/1.0 200 OK\r\n" + SERVER + ALLOW + "Content-Type: image/gif\r\n" + DATE + EXPIRES + "\r\n"},
        {"304", Http::NOT_MODIFIED_304, Http::TYPE_HTML, nullptr,
         "HTTP/1.0 304 Not Modified\r\n" + DATE + SERVER + "\r\n"},
        {"304 image", Http::NOT_MODIFIED_304, Http::TYPE_GIF, "A: b\r\n",
         "HTTP/1.0 304 Not Modified\r\n" + DATE + EXPIRES + SERVER + "A: b\r\n\r\n"},
        {"404", Http::NOT_FOUND_404, Http::TYPE_NONE, nullptr,
         "HTTP/1.0 404 Not Found\r\nContent-Length: 140\r\n\r\n<html><HEAD><TITLE>404 Not Found</TITLE></HEAD>\r\n"
         "<BODY><H1>404 Not Found</H1>\r\nThe requested URL was not found on this server.</body></html>"},
        {"401 extra headers", Http::UNAUTHORIZED_401, Http::TYPE_GIF, "WWW-Authenticate: Basic realm=\"x\r\n",
         "HTTP/1.0 401 Unauthorized\r\nWWW-Authenticate: Basic realm=\"x\r\nContent-Length: 124\r\n\r\n"
         "<html><HEAD><TITLE>401 Unauthorized</TITLE></HEAD><BODY><H1>401 Unauthorized</H1>\r\n"
         "Authentication required.<P></body></html>"},
        {"500 script", Http::INTERNAL_SERVER_ERROR_SCRIPT, Http::TYPE_NONE, nullptr,
         "HTTP/1.0 500 Internal Server Error\r\nContent-Length: 222\r\n\r\n<html><HEAD><TITLE>500 Server "
         "Error</TITLE></HEAD>\r\n<BODY><H2>500 Server Error - Script Failed</H2>An error occured while processing a "
         "CGI script. The server was unable to continue processing your request.<P></body></html>"},
        {"no page", Http::NO_CONTENT_204, Http::TYPE_HTML, nullptr, "HTTP/1.0 204 No Content\r\n\r\n"},
        {"no page extra headers", Http::MOVED_TEMPORARILY_302, Http::TYPE_NONE, "Location: /\r\n",
         "HTTP/1.0 302 Moved Temporarily\r\nLocation: /\r\n\r\n"},
    };
    const ManualClock clock;
    for (const auto& c : cases) {
        oxReply composed(c.status, c.type, -1, 0, c.extra);
        composed.SetClock(clock);
        EXPECT_EQ(c.expected, composed.ComposeHeader()) << c.name;

        const bool isOk = c.status.code == 200;
        oxReply sent(c.status, c.type, isOk ? FileOf("body") : -1, 4, c.extra);
        const Sent result = Send(sent);
        EXPECT_EQ(c.expected + (isOk ? "body" : ""), result.text) << c.name;
        EXPECT_EQ(isOk ? 4u : 0u, result.bytes) << c.name;
        EXPECT_EQ(isOk ? 1000 : 0, result.touched) << c.name;
        EXPECT_TRUE(result.lines.empty()) << c.name;
    }
}

TEST(OxReply, CodesAreComparedNotObjects) {
    const oxHttpStatus ok{200, "200", "Fine", "not sent"};
    oxReply reply(ok, Http::TYPE_HTML, FileOf("x"), 1, nullptr);
    EXPECT_EQ("HTTP/1.0 200 Fine\r\n" + SERVER + ALLOW + "Content-Type: text/html\r\n" + DATE + "\r\nx",
              Send(reply).text);
}

TEST(OxReply, PlainStatus) {
    oxReply reply(Http::BAD_REQUEST_400);
    EXPECT_EQ(&Http::BAD_REQUEST_400, &reply.GetStatus());
    EXPECT_EQ(0u, reply.GetContentSize());
    const std::string text = Send(reply).text;
    EXPECT_TRUE(text.starts_with("HTTP/1.0 400 Bad Request\r\nContent-Length: 133\r\n\r\n<html>")) << text;
    EXPECT_EQ(reply.ComposeHeader(), text);
}

TEST(OxReply, ContentSizeIsOnlyCarried) {
    oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf("body"), 4000000000u, std::string("A: b\r\n"));
    EXPECT_EQ(4000000000u, reply.GetContentSize());
    EXPECT_EQ(4u, Send(reply).bytes);
}

TEST(OxReply, OkWithoutFileSendsNothing) {
    oxReply reply(Http::OK_200, Http::TYPE_HTML, -1, 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ("", sent.text);
    EXPECT_EQ(0, sent.touched);
}

TEST(OxReply, EmptyFileGetsItsHeader) {
    oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf(""), 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ(OkHeader("text/html"), sent.text);
    EXPECT_EQ(0u, sent.bytes);
}

TEST(OxReply, FilesOfManyBlocks) {
    for (const std::size_t length : {20479u, 20480u, 20481u, 40960u, 100000u, 5000000u}) {
        std::string body(length, '\0');
        for (std::size_t i = 0; i < length; ++i)
            body[i] = static_cast<char>(i * 11 + i / 253);
        for (const Connection::Kind kind : {Connection::STREAM, Connection::TCP}) {
            oxReply reply(Http::OK_200, Http::TYPE_NONE, FileOf(body), 0, nullptr);
            const Sent sent = Send(reply, kind);
            EXPECT_EQ(OkHeader("") + body, sent.text) << length;
            EXPECT_EQ(length, sent.bytes);
            EXPECT_TRUE(sent.lines.empty());
        }
    }
}

TEST(OxReply, HeaderAndFirstBlockTravelTogether) {
    static std::vector<std::pair<std::size_t, int>> calls;
    for (const std::size_t length : {0u, 1u, 20480u, 20481u}) {
        calls.clear();
        const SendStub stub([](int socket, const void* data, size_t size, int flags) {
            calls.emplace_back(size, flags & ~MSG_NOSIGNAL);
            return ::send(socket, data, size, flags);
        });
        oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf(std::string(length, 'x')), 0, nullptr);
        Send(reply);
        std::vector<std::pair<std::size_t, int>> expected = {{OkHeader("text/html").size(), length > 0 ? MSG_MORE : 0}};
        for (std::size_t left = length; left > 0; left -= expected.back().first)
            expected.emplace_back(std::min<std::size_t>(left, 20480), 0);
        EXPECT_EQ(expected, calls) << length;
    }
}

TEST(OxReply, ShortSendsAreContinued) {
    static int calls;
    calls = 0;
    const SendStub stub([](int socket, const void* data, size_t size, int flags) {
        // Every third call is refused for the moment.
        if (++calls % 3 == 0) {
            errno = calls % 2 == 0 ? EAGAIN : EINTR;
            return ssize_t{-1};
        }
        return ::send(socket, data, std::min<std::size_t>(size, 7), flags);
    });
    const std::string body = "<html>" + std::string(300, 'b');
    oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf(body), 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ(OkHeader("text/html") + body, sent.text);
    EXPECT_TRUE(sent.lines.empty());

    oxReply error(Http::NOT_FOUND_404);
    EXPECT_EQ(error.ComposeHeader(), Send(error).text);
}

TEST(OxReply, TimeStampIsTouchedBeforeEveryBlock) {
    // Each look at the clock counts.
    class CountingClock : public ManualClock {
    public:
        std::int64_t MonotonicSeconds() const override { return ++m_looks; }
        mutable std::int64_t m_looks = 0;
    };
    const struct {
        std::size_t length;
        std::int64_t touched;
    } cases[] = {{0, 1}, {1, 2}, {20480, 2}, {20481, 3}, {40960, 3}};
    for (const auto& c : cases) {
        const CountingClock clock;
        oxTimeStamp stamp(clock);
        Connection connection;
        LineLog log;
        oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf(std::string(c.length, 'x')), 0, nullptr);
        std::jthread peer([&] { connection.PeerReadAll(); });
        reply.Send(connection.Server(), stamp, log);
        connection.Server().Close();
        EXPECT_EQ(c.touched, clock.m_looks) << c.length;
        EXPECT_EQ(c.touched, stamp.Seconds()) << c.length;
    }
}

TEST(OxReply, SendErrorEndsTheReply) {
    static int calls;
    calls = 0;
    const SendStub stub([](int socket, const void* data, size_t size, int flags) {
        if (++calls <= 2)
            return ::send(socket, data, size, flags);
        errno = ECONNRESET;
        return ssize_t{-1};
    });
    const int file = FileOf(std::string(100000, 'x'));
    oxReply reply(Http::OK_200, Http::TYPE_NONE, file, 0, nullptr);
    const Sent sent = Send(reply);
    EXPECT_EQ(OkHeader("") + std::string(20480, 'x'), sent.text);
    EXPECT_EQ(std::vector<std::string>{"Reply error writing to socket - socket error = 104"}, sent.lines);
    EXPECT_EQ(2u * 20480, sent.bytes);
    EXPECT_EQ(3, calls);
    EXPECT_FALSE(IsOpen(file));
}

TEST(OxReply, HeaderSendErrorIsNotReported) {
    const SendStub stub([](int, const void*, size_t, int) {
        errno = EPIPE;
        return ssize_t{-1};
    });
    oxReply empty(Http::OK_200, Http::TYPE_NONE, FileOf(""), 0, nullptr);
    EXPECT_TRUE(Send(empty).lines.empty());
    oxReply error(Http::NOT_FOUND_404);
    EXPECT_TRUE(Send(error).lines.empty());
}

TEST(OxReply, CloseByAnotherThreadEndsABlockedReply) {
    for (const Connection::Kind kind : {Connection::STREAM, Connection::TCP}) {
        Connection connection(kind);
        LineLog log;
        ManualClock clock;
        oxTimeStamp stamp(clock);
        const int file = ::memfd_create("body", MFD_CLOEXEC);
        ASSERT_EQ(0, ::ftruncate(file, 64 << 20));
        oxReply reply(Http::OK_200, Http::TYPE_NONE, file, 0, nullptr);
        std::jthread closer([&] {
            char c;
            ::recv(connection.Peer(), &c, 1, 0);  // it has begun; nothing more is read
            connection.Server().Close();
        });
        reply.Send(connection.Server(), stamp, log);
        ASSERT_EQ(1u, log.Lines().size());
        EXPECT_TRUE(log.Lines()[0].starts_with("Reply error writing to socket - socket error = ")) << log.Lines()[0];
        EXPECT_FALSE(IsOpen(file));
    }
}

TEST(OxReply, UnreadBodyIsDrained) {
    // Whole multiples of the block too: the last receive must not wait for more.
    for (const std::size_t unread : {std::size_t{1}, oxReply::DRAIN_BLOCK, 2 * oxReply::DRAIN_BLOCK}) {
        Connection connection;
        LineLog log;
        ManualClock clock;
        oxTimeStamp stamp(clock);
        ASSERT_TRUE(connection.PeerSend(std::string(unread, 'b')));
        oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf("body"), 4, nullptr);
        reply.SetClock(clock);
        reply.Send(connection.Server(), stamp, log);
        EXPECT_EQ(0, connection.Server().BytesAvailable()) << unread;
        connection.Server().Close();
        EXPECT_EQ(OkHeader("text/html") + "body", connection.PeerReadAll()) << unread;
    }
}

TEST(OxReply, DrainsWithElevenReadsAtMost) {
    static int calls;
    calls = 0;
    oxSocket::m_lpfnrecv = [](int, void*, size_t length, int flags) {
        ++calls;
        EXPECT_EQ(MSG_DONTWAIT, flags);
        EXPECT_EQ(65535u, length);
        return static_cast<ssize_t>(length);
    };
    oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf("body"), 4, nullptr);
    const Sent sent = Send(reply);
    oxSocket::m_lpfnrecv = ::recv;
    EXPECT_EQ(11, calls);
    EXPECT_EQ(OkHeader("text/html") + "body", sent.text);
}

TEST(OxReply, DrainEndsWithTheFirstReceiveThatIsNotFull) {
    static int calls;
    for (const ssize_t last : {ssize_t{65534}, ssize_t{1}, ssize_t{0}, ssize_t{-1}}) {
        static ssize_t third;
        calls = 0;
        third = last;
        oxSocket::m_lpfnrecv = [](int, void*, size_t length, int) {
            if (++calls != 3)
                return static_cast<ssize_t>(length);
            errno = EAGAIN;
            return third;
        };
        oxReply reply(Http::OK_200, Http::TYPE_HTML, FileOf("body"), 4, nullptr);
        const Sent sent = Send(reply);
        oxSocket::m_lpfnrecv = ::recv;
        EXPECT_EQ(3, calls) << last;
        EXPECT_EQ(OkHeader("text/html") + "body", sent.text) << last;
    }
}

TEST(OxReply, ErrorStatusesDoNotDrain) {
    Connection connection;
    LineLog log;
    ManualClock clock;
    oxTimeStamp stamp(clock);
    ASSERT_TRUE(connection.PeerSend("unread"));
    oxReply(Http::NOT_FOUND_404).Send(connection.Server(), stamp, log);
    EXPECT_EQ(6, connection.Server().BytesAvailable());
}

}  // namespace
