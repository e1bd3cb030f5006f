#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <thread>

#include "protocol/nomemory.h"
#include "protocol/request.h"
#include "protocol/testsockets.h"

namespace {

constexpr std::size_t LIMIT = oxRequestLimits::INLINE_BUFFER - 1;
const std::string TIMED_OUT = "Error reading request from socket - socket timed out.";

// A request line and headers of exactly the given length, the blank line included.
std::string HeaderBlock(std::size_t length, const std::string& headers = {}) {
    const std::string start = "POST /run HTTP/1.0\r\n" + headers + "X: ";
    return start + std::string(length - start.size() - 4, 'x') + "\r\n\r\n";
}

std::string LengthHeader(const std::string& length) {
    return "Content-Length: " + length + "\r\n";
}

// Bytes that are not all alike.
std::string Bytes(std::size_t length) {
    std::string bytes(length, '\0');
    for (std::size_t i = 0; i < length; ++i)
        bytes[i] = static_cast<char>(i * 7 + i / 251);
    return bytes;
}

struct ReadResult {
    bool good;
    int status;
    bool complete;
    std::string body;

    bool operator==(const ReadResult&) const = default;
};

std::ostream& operator<<(std::ostream& out, const ReadResult& r) {
    return out << "good=" << r.good << " status=" << r.status << " complete=" << r.complete << " body of "
               << r.body.size();
}

const ReadResult GOOD{true, 0, true, ""};
const ReadResult TOO_LARGE{false, -3, false, ""};

ReadResult Read(oxSocket& socket, LineLog& log) {
    const auto request = std::make_unique<oxRequest>();
    const bool good = request->Read(socket, log);
    return {good, request->GetStatus(), request->IsComplete(), std::string(request->GetBody())};
}

enum class Then { End, Nothing };

// The result for a text that streams in, followed by the end of the connection or by nothing.
ReadResult ReadText(std::string_view text, Then then) {
    Connection connection;
    LineLog log;
    std::jthread sender([&] {
        if (connection.PeerSend(text) && then == Then::End)
            connection.PeerEnd();
    });
    const ReadResult result = Read(connection.Server(), log);
    EXPECT_TRUE(log.Lines().empty());
    connection.Server().Close();  // a sender that is not done gives up
    return result;
}

// Puts a function into the socket's table for the life of the object.
class RecvStub {
public:
    explicit RecvStub(ssize_t (*function)(int, void*, size_t, int)) { oxSocket::m_lpfnrecv = function; }
    ~RecvStub() { oxSocket::m_lpfnrecv = ::recv; }
};

TEST(OxRequestRead, HeaderBlockOf32766BytesIsTheLongest) {
    EXPECT_EQ(GOOD, ReadText(HeaderBlock(LIMIT), Then::Nothing));
    EXPECT_EQ(TOO_LARGE, ReadText(HeaderBlock(LIMIT + 1), Then::Nothing));
    EXPECT_EQ(TOO_LARGE, ReadText(std::string(LIMIT, 'x'), Then::Nothing));
    EXPECT_EQ(TOO_LARGE, ReadText(std::string(40000, 'x'), Then::End));
    EXPECT_EQ(GOOD, ReadText(std::string(LIMIT - 1, 'x'), Then::End));
}

TEST(OxRequestRead, BodyThatFitsIsTakenAsSoonAsItIsComplete) {
    for (const std::size_t length : {std::size_t{1}, std::size_t{5}, LIMIT - 1001, LIMIT - 1000, LIMIT - 999}) {
        const std::string body = Bytes(length);
        EXPECT_EQ((ReadResult{true, 0, true, body}),
                  ReadText(HeaderBlock(1000, LengthHeader(std::to_string(length))) + body, Then::Nothing));
    }
}

TEST(OxRequestRead, LargestBody) {
    for (const std::size_t header : {std::size_t{100}, LIMIT - 1}) {
        const std::string body = Bytes(2064384);
        EXPECT_EQ((ReadResult{true, 0, true, body}),
                  ReadText(HeaderBlock(header, LengthHeader("2064384")) + body, Then::Nothing));
    }
}

// The largest header block and any body fill the large buffer to its last byte, which counts as more than was
// announced.
TEST(OxRequestRead, LargestHeaderBlockTakesNoBody) {
    for (const std::size_t length : {std::size_t{1}, std::size_t{40000}}) {
        const std::string text = HeaderBlock(LIMIT, LengthHeader(std::to_string(length))) + std::string(length, 'b');
        EXPECT_EQ((ReadResult{false, -4, false, ""}), ReadText(text, Then::Nothing));
    }
}

TEST(OxRequestRead, LengthTooLargeIsFoundOnlyWhenTheInlineBufferIsFull) {
    for (const char* length :
         {"2064385", "2097152", "2147483647", "4294967301", "99999999999", "18446744073709551617"}) {
        const std::string text = HeaderBlock(1000, LengthHeader(length)) + std::string(LIMIT - 1000, 'b');
        EXPECT_EQ(GOOD, ReadText(std::string_view(text).substr(0, LIMIT - 1), Then::End)) << length;
        EXPECT_EQ(TOO_LARGE, ReadText(text, Then::Nothing)) << length;
    }
}

TEST(OxRequestRead, FullInlineBufferWithoutBody) {
    const std::string more(LIMIT, 'b');
    EXPECT_EQ(GOOD, ReadText(HeaderBlock(1000) + more, Then::Nothing));
    EXPECT_EQ(GOOD, ReadText(HeaderBlock(1000, LengthHeader("0")) + more, Then::Nothing));
    EXPECT_EQ(GOOD, ReadText(HeaderBlock(1000, LengthHeader("-5")) + more, Then::Nothing));
    EXPECT_EQ(GOOD, ReadText(HeaderBlock(1000) + LengthHeader("9999999") + more, Then::Nothing));
    EXPECT_EQ((ReadResult{true, 0, true, "bbb"}), ReadText(HeaderBlock(1000, LengthHeader("3")) + more, Then::Nothing));
}

TEST(OxRequestRead, BodyCutByTheEndIsNone) {
    const std::string text = HeaderBlock(1000, LengthHeader("40000")) + std::string(40000, 'b');
    for (const std::size_t length :
         {std::size_t{500}, std::size_t{1000}, std::size_t{1001}, LIMIT, LIMIT + 1, text.size() - 1})
        EXPECT_EQ(GOOD, ReadText(std::string_view(text).substr(0, length), Then::End)) << length;
}

TEST(OxRequestRead, NothingAtAll) {
    EXPECT_EQ(GOOD, ReadText("", Then::End));
}

// The text comes in two pieces, the second not before the first was received.
TEST(OxRequestRead, CutsAroundTheExchangeOfBuffers) {
    const std::string body = Bytes(33000);
    const std::string text = HeaderBlock(1000, LengthHeader("33000")) + body;
    for (std::size_t at = LIMIT - 3; at <= LIMIT + 3; ++at) {
        Connection connection;
        LineLog log;
        std::jthread sender([&] {
            connection.PeerSend(std::string_view(text).substr(0, at));
            connection.WaitUntilTaken();
            connection.PeerSend(std::string_view(text).substr(at));
        });
        EXPECT_EQ((ReadResult{true, 0, true, body}), Read(connection.Server(), log)) << at;
    }
}

TEST(OxRequestRead, MoreThanTheAnnouncedBodyFillsTheLargeBuffer) {
    Connection connection;
    LineLog log;
    ASSERT_TRUE(connection.PeerSend(HeaderBlock(1000, LengthHeader("40000")) + std::string(40000 + LIMIT + 5000, 'b')));
    EXPECT_EQ((ReadResult{false, -4, false, ""}), Read(connection.Server(), log));
    EXPECT_EQ(0, connection.Server().BytesAvailable());
    EXPECT_TRUE(log.Lines().empty());
}

TEST(OxRequestRead, MoreThanTheAnnouncedBodyThatFitsTheLargeBufferIsLeftOut) {
    Connection connection;
    LineLog log;
    const std::string body = Bytes(40000);
    ASSERT_TRUE(connection.PeerSend(HeaderBlock(1000, LengthHeader("40000")) + body + "more"));
    EXPECT_EQ((ReadResult{true, 0, true, body}), Read(connection.Server(), log));
}

TEST(OxRequestRead, DrainsWithElevenReadsAtMost) {
    static int calls;
    static int drains;
    calls = drains = 0;
    const RecvStub stub([](int, void* buffer, size_t length, int flags) {
        EXPECT_EQ(MSG_DONTWAIT, flags);
        std::memset(buffer, 'b', length);
        const std::string header = HeaderBlock(1000, LengthHeader("40000"));
        if (calls++ == 0)
            std::memcpy(buffer, header.data(), header.size());
        drains += length == oxRequestLimits::INLINE_BUFFER ? 1 : 0;
        return static_cast<ssize_t>(length);
    });
    Connection connection;
    LineLog log;
    EXPECT_EQ((ReadResult{false, -4, false, ""}), Read(connection.Server(), log));
    EXPECT_EQ(11, drains);
    EXPECT_EQ(2 + 11, calls);
}

TEST(OxRequestRead, DrainEndsWithTheFirstReceiveThatIsNotFull) {
    static int calls;
    static ssize_t third;
    const auto full = static_cast<ssize_t>(oxRequestLimits::INLINE_BUFFER);
    for (const ssize_t last : {full - 1, ssize_t{1}, ssize_t{0}, ssize_t{-1}}) {
        calls = 0;
        third = last;
        const RecvStub stub([](int, void* buffer, size_t length, int) {
            constexpr int FILLS = 2;  // of the inline buffer and of the large one
            const std::string header = HeaderBlock(1000, LengthHeader("40000"));
            if (calls == 0)
                std::memcpy(buffer, header.data(), header.size());
            if (++calls != FILLS + 3)
                return static_cast<ssize_t>(length);
            errno = EAGAIN;
            return third;
        });
        Connection connection;
        LineLog log;
        EXPECT_EQ((ReadResult{false, -4, false, ""}), Read(connection.Server(), log)) << last;
        EXPECT_EQ(2 + 3, calls) << last;
    }
}

bool ReadWithoutMemory(oxRequest& request, oxSocket& socket, LineLog& log) {
    const NoMemory none;
    return request.Read(socket, log);
}

TEST(OxRequestRead, WithoutMemoryForTheLargeBufferTheRequestIsTooLarge) {
    Connection connection;
    LineLog log;
    ASSERT_TRUE(connection.PeerSend(HeaderBlock(1000, LengthHeader("40000")) + std::string(40000, 'b')));
    oxRequest request;
    EXPECT_FALSE(ReadWithoutMemory(request, connection.Server(), log));
    EXPECT_EQ(oxRequest::STATUS_TOO_LARGE, request.GetStatus());
    EXPECT_TRUE(log.Lines().empty());
}

TEST(OxRequestRead, WithoutMemoryAUsualRequestIsRead) {
    for (const std::string& text : {HeaderBlock(LIMIT), HeaderBlock(1000, LengthHeader("5000")) + Bytes(5000)}) {
        Connection connection;
        LineLog log;
        ASSERT_TRUE(connection.PeerSend(text));
        oxRequest request;
        EXPECT_TRUE(ReadWithoutMemory(request, connection.Server(), log));
        EXPECT_TRUE(request.IsComplete());
    }
}

TEST(OxRequestRead, WaitThatFailsIsASocketError) {
    const RecvStub stub([](int handle, void*, size_t, int) {
        ::close(handle);  // below the socket, which does not know
        errno = EAGAIN;
        return ssize_t{-1};
    });
    Connection connection;
    LineLog log;
    EXPECT_EQ((ReadResult{false, -2, false, ""}), Read(connection.Server(), log));
    EXPECT_EQ(std::vector<std::string>{"Error reading request from socket - socket error = 9"}, log.Lines());
}

TEST(OxRequestRead, ErrorTable) {
    static int error;
    static int calls;
    const struct {
        int error;
        int status;
        std::vector<std::string> lines;
    } cases[] = {
        {ECONNABORTED, -1, {}},
        {ECONNRESET, -1, {}},
        {ENOBUFS, -2, {"Error reading request from socket - socket error = 105"}},
        {ETIMEDOUT, -2, {"Error reading request from socket - socket error = 110"}},
        {ENOTCONN, -2, {"Error reading request from socket - socket error = 107"}},
    };
    for (const auto& c : cases) {
        error = c.error;
        const RecvStub stub([](int, void*, size_t, int) {
            errno = error;
            return ssize_t{-1};
        });
        Connection connection;
        LineLog log;
        EXPECT_EQ((ReadResult{false, c.status, false, ""}), Read(connection.Server(), log)) << c.error;
        EXPECT_EQ(c.lines, log.Lines()) << c.error;
    }
    // Neither an interruption nor a socket that was not ready after all ends the read.
    for (const int repeated : {EINTR, EAGAIN}) {
        error = repeated;
        calls = 0;
        const RecvStub stub([](int socket, void* buffer, size_t length, int flags) {
            errno = error;
            return ++calls <= 3 ? ssize_t{-1} : ::recv(socket, buffer, length, flags);
        });
        Connection connection;
        LineLog log;
        ASSERT_TRUE(connection.PeerSend("GET / HTTP/1.0\r\n\r\n"));
        EXPECT_EQ(GOOD, Read(connection.Server(), log));
        EXPECT_EQ(4, calls);
    }
}

TEST(OxRequestRead, ResetByThePeerIsSilent) {
    Connection connection(Connection::TCP);
    LineLog log;
    ASSERT_TRUE(connection.PeerSend("GET / HT"));
    std::jthread peer([&] {
        connection.WaitUntilTaken();
        connection.PeerReset();
    });
    EXPECT_EQ((ReadResult{false, -1, false, ""}), Read(connection.Server(), log));
    EXPECT_TRUE(log.Lines().empty());
}

TEST(OxRequestRead, SocketThatIsNotOpenTimesOut) {
    Connection connection;
    LineLog log;
    connection.Server().Close();
    EXPECT_EQ((ReadResult{false, 0, false, ""}), Read(connection.Server(), log));
    EXPECT_EQ(std::vector<std::string>{TIMED_OUT}, log.Lines());
}

TEST(OxRequestRead, CloseByAnotherThreadTimesOut) {
    for (const Connection::Kind kind : {Connection::STREAM, Connection::TCP}) {
        for (const char* text : {"", "GET / HTTP/1.0\r\n"}) {
            Connection connection(kind);
            LineLog log;
            ASSERT_TRUE(connection.PeerSend(text));
            std::jthread closer([&] {
                connection.WaitUntilTaken();
                connection.Server().Close();
            });
            EXPECT_EQ((ReadResult{false, 0, false, ""}), Read(connection.Server(), log));
            EXPECT_EQ(std::vector<std::string>{TIMED_OUT}, log.Lines());
        }
    }
}

// What a receive brought does not count any more when the socket was closed meanwhile.
TEST(OxRequestRead, ClosedDuringAReceiveTimesOut) {
    static oxSocket* socket;
    for (const char* text : {"", "GET / HTTP/1.0\r\n\r\n"}) {
        Connection connection;
        LineLog log;
        socket = &connection.Server();
        ASSERT_TRUE(connection.PeerSend(text));
        connection.PeerEnd();
        const RecvStub stub([](int handle, void* buffer, size_t length, int flags) {
            const ssize_t count = ::recv(handle, buffer, length, flags);
            std::jthread([] { socket->Close(); }).join();
            return count;
        });
        EXPECT_EQ((ReadResult{false, 0, false, ""}), Read(connection.Server(), log));
        EXPECT_EQ(std::vector<std::string>{TIMED_OUT}, log.Lines());
    }
}

TEST(OxRequestRead, SignalsDoNotEndTheWait) {
    struct sigaction action {};
    struct sigaction before {};
    static std::atomic<int> caught;
    caught = 0;
    action.sa_handler = [](int) { ++caught; };
    ASSERT_EQ(0, ::sigaction(SIGUSR1, &action, &before));
    Connection connection;
    LineLog log;
    const pthread_t reader = ::pthread_self();
    std::jthread sender([&] {
        for (const char c : std::string("GET / HTTP/1.0\r\n\r\n")) {
            const int seen = caught;
            ::pthread_kill(reader, SIGUSR1);
            while (caught == seen)
                ::sched_yield();
            connection.PeerSend({&c, 1});
        }
    });
    EXPECT_EQ(GOOD, Read(connection.Server(), log));
    sender.join();
    EXPECT_GE(caught, 18);
    EXPECT_TRUE(log.Lines().empty());
    ::sigaction(SIGUSR1, &before, nullptr);
}

}  // namespace
