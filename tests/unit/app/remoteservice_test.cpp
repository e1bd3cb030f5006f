// The client of the remote service, against services that answer well, badly, late or not at all.
#include <fcntl.h>
#include <netinet/tcp.h>
#include <sys/resource.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "app/appfixture.h"
#include "app/fakeservice.h"
#include "testing/client.h"
#include "testing/injected.h"
#include "testing/waiting.h"

namespace {

using std::chrono::seconds;
using std::chrono::steady_clock;
using Lines = std::vector<std::string>;
using Peer = FakeService::Peer;

constexpr const char* UNABLE_TO_PARSE = "oxxHttpServer::ProcessReply : unable to parse relpy.";
constexpr const char* UNABLE_TO_RECEIVE = "oxxHttpServer::ProcessReply : unable to receive request.";
constexpr const char* TOO_LARGE = "oxxHttpServer::Receive: error reading request - the request was too large";
constexpr std::size_t MAX_RECEIVED = 65533;

std::string ReceiveFailed(int error) {
    return "oxxHttpServer::Receive: error reading request from socket - socket error = " + std::to_string(error);
}
std::string Disconnected(int error) {
    return "oxxHttpServer::Receive: error - client disconnected - socket error = " + std::to_string(error);
}
std::string ConnectFailed(int error, const std::string& text) {
    return "oxxHttpServer::SendERSRequest : connect failed - socket error = " + std::to_string(error) + " " + text;
}

class RemoteService : public AppFixture {
protected:
    // The status, a bar, the reply text.
    std::string Ask(const std::string& contextString = "ctx", int command = 99, const std::string& argument = "a=b",
                    std::size_t size = 65535) {
        std::vector<char> reply(size + 1, '~');
        reply[0] = size == 0 ? '~' : '\0';
        const int status = server->SendERSRequest(contextString.c_str(), command, argument.c_str(), reply.data(), size);
        EXPECT_EQ('~', reply[size]) << "written past the buffer";
        return std::to_string(status) + "|" + (size == 0 ? "" : reply.data());
    }
    void UseService(const std::string& address, int timeout = 60, int retries = 1) {
        SetUp("ErsTimeout=" + std::to_string(timeout) + "\nErsRetries=" + std::to_string(retries) + "\n", address);
        ForgetMessages();
    }
    // Takes the answer that lies in the socket.
    std::string Process(oxSocket& socket) {
        std::vector<char> reply(65536);
        const int status = server->ProcessReply(socket, reply.data(), reply.size());
        return std::to_string(status) + "|" + reply.data();
    }
};

}  // namespace

TEST_F(RemoteService, RequestIsOneLineOfFourFields) {
    static const struct {
        const char* contextString;
        int command;
        const char* argument;
        const char* request;
    } CASES[] = {
        {"ctx", 99, "a=b", "ctx|99|a=b|EOT"},
        {"ctx", 99, "", "ctx|99|x|EOT"},
        {"", 0, "", "|0|x|EOT"},
        {"two words", -5, "x", "two words|-5|x|EOT"},
        {"ctx", 2147483647, "a|b", "ctx|2147483647|a|b|EOT"},
        {"ctx", -2147483647 - 1, "name=%7C&x=\xc3\xa4\n", "ctx|-2147483648|name=%7C&x=\xc3\xa4\n|EOT"},
    };
    FakeService service("0|done|EOT");
    UseService(service.Address());
    Lines expected;
    for (const auto& test : CASES) {
        EXPECT_EQ("0|done", Ask(test.contextString, test.command, test.argument));
        expected.emplace_back(test.request);
    }
    EXPECT_EQ(expected, service.Requests());
    EXPECT_EQ(Lines{}, Messages());
}

TEST_F(RemoteService, AnswersGiveTheirStatusAndText) {
    static const struct {
        std::string answer;
        const char* result;
        Lines lines;
    } CASES[] = {
        {"0|done|EOT", "0|done", {}},
        {"0||EOT", "0|", {}},
        {"-1|statusdesc=no|EOT", "-1|statusdesc=no", {}},
        {"0000000000000042|16 characters|EOT", "42|16 characters", {}},
        {"00000000000000042|17 characters|EOT", "-256|", {UNABLE_TO_PARSE}},
        {"0|marker of 2|EO", "-256|", {UNABLE_TO_PARSE}},
        {"0|marker of 3|EOT", "0|marker of 3", {}},
        {"0|marker of 4|EOTx", "-256|", {UNABLE_TO_PARSE}},
        {"0|marker of 5|EOTxy", "-256|", {UNABLE_TO_PARSE}},
        {"0|x|EOT\n", "-256|", {UNABLE_TO_PARSE}},
        {"0|no marker|", "-256|", {UNABLE_TO_PARSE}},
        {"0|no marker", "-256|", {UNABLE_TO_PARSE}},
        {"|no status|EOT", "-256|", {UNABLE_TO_PARSE}},
        {"", "-256|", {UNABLE_TO_PARSE}},
        {std::string("\0|EOT", 5), "-256|", {UNABLE_TO_PARSE}},
        {"\x80\xff\x01garbage\r\n", "-256|", {UNABLE_TO_PARSE}},
        {"HTTP/1.0 400 Bad Request\r\n\r\n<html>", "-256|", {UNABLE_TO_PARSE}},
        {std::string(60000, '|'), "-256|", {UNABLE_TO_PARSE}},
    };
    for (const auto& test : CASES) {
        SCOPED_TRACE(test.answer.substr(0, 40));
        FakeService service(test.answer);
        UseService(service.Address());
        EXPECT_EQ(test.result, Ask());
        EXPECT_EQ(test.lines, Messages());
    }
}

TEST_F(RemoteService, AnswerIsTakenBeforeTheServiceCloses) {
    FakeService service([](Peer& peer, const std::string&) {
        EXPECT_TRUE(peer.Send("0|done|EOT"));
        EXPECT_TRUE(peer.WaitForEnd());  // the client ends the connection
    });
    UseService(service.Address());
    EXPECT_EQ("0|done", Ask());
    EXPECT_EQ("0|done", Ask());
}

TEST_F(RemoteService, ReplyTextIsCutToTheCallersBuffer) {
    FakeService service("7|done|EOT");
    UseService(service.Address());
    static const struct {
        std::size_t size;
        const char* result;
    } CASES[] = {{6, "7|done"}, {5, "7|done"}, {4, "7|don"}, {2, "7|d"}, {1, "7|"}, {0, "7|"}};
    for (const auto& test : CASES)
        EXPECT_EQ(test.result, Ask("ctx", 99, "", test.size)) << test.size;
}

TEST_F(RemoteService, EmptyReplyTextEmptiesTheBuffer) {
    Connection connection;
    UseService("127.0.0.1:1");
    ASSERT_TRUE(connection.PeerSend("3||EOT"));
    char reply[] = "before";
    EXPECT_EQ(3, server->ProcessReply(connection.Server(), reply, sizeof reply));
    EXPECT_STREQ("", reply);
}

TEST_F(RemoteService, FailureLeavesTheBufferAlone) {
    Connection connection;
    UseService("127.0.0.1:1");
    ASSERT_TRUE(connection.PeerSend("3|x|EOT\n"));
    char reply[] = "before";
    EXPECT_EQ(oxxHttpServer::ERS_UNREACHABLE, server->ProcessReply(connection.Server(), reply, sizeof reply));
    EXPECT_STREQ("before", reply);
}

TEST_F(RemoteService, AnswerMayComeInPiecesCutAnywhere) {
    UseService("127.0.0.1:1");
    const std::string answer = "-12|a reply|EOT";
    for (std::size_t cut = 1; cut < answer.size(); ++cut) {
        Connection connection(Connection::PIECES);
        ASSERT_TRUE(connection.PeerSend(answer.substr(0, cut)));
        ASSERT_TRUE(connection.PeerSend(answer.substr(cut)));
        EXPECT_EQ("-12|a reply", Process(connection.Server())) << cut;
    }
    Connection connection(Connection::PIECES);
    for (const char c : answer)
        ASSERT_TRUE(connection.PeerSend({&c, 1}));
    EXPECT_EQ("-12|a reply", Process(connection.Server()));
    EXPECT_EQ(Lines{}, Messages());
}

TEST_F(RemoteService, ReceivingEndsWithTheMarkerWhereverItComes) {
    static const struct {
        Lines pieces;
        std::string received;
    } CASES[] = {
        {{"0|x|EOT", "more"}, "0|x|EOT"},
        {{"0|aEOTb|", "EOT"}, "0|aEOTb|"},
        {{"0|x|E", "O", "T", "more"}, "0|x|EOT"},
        {{"EOT", "more"}, "EOT"},
        {{"0|x|EOTmore"}, "0|x|EOTmore"},
        {{std::string("0|\0|", 4), "EOT", "more"}, std::string("0|\0|EOT", 7)},
        {{"E", "EO", "EOT", "more"}, "EEOEOT"},
    };
    UseService("127.0.0.1:1");
    for (const auto& test : CASES) {
        Connection connection(Connection::PIECES);
        for (const std::string& piece : test.pieces)
            ASSERT_TRUE(connection.PeerSend(piece));
        std::vector<char> buffer(1000);
        EXPECT_TRUE(server->Receive(connection.Server(), buffer.data(), buffer.size()));
        buffer.resize(test.received.size() + 1);
        EXPECT_EQ(test.received + '\0', std::string(buffer.data(), buffer.size()));
    }
}

TEST_F(RemoteService, LargestAnswerIsOneByteLessThanTheBuffer) {
    for (const std::size_t size :
         {MAX_RECEIVED - 1, MAX_RECEIVED, MAX_RECEIVED + 1, MAX_RECEIVED + 2, 3 * MAX_RECEIVED}) {
        SCOPED_TRACE(size);
        const std::string text(size - 6, 'x');
        FakeService service("5|" + text + "|EOT");
        UseService(service.Address());
        const bool fits = size <= MAX_RECEIVED;
        EXPECT_TRUE((fits ? "5|" + text : "-256|") == Ask());
        EXPECT_EQ((fits ? Lines{} : Lines{TOO_LARGE, UNABLE_TO_RECEIVE}), Messages());
    }
}

TEST_F(RemoteService, OfATooLargeAnswerLittleMoreIsRead) {
    static const struct {
        int more;  // behind what filled the buffer
        int left;
    } CASES[] = {{0, 0}, {4, 0}, {6, 0}, {39, 0}, {40, 0}, {41, 1}, {100, 60}};
    UseService("127.0.0.1:1");
    for (const auto& test : CASES) {
        Connection connection;
        char buffer[16] = {};
        ASSERT_TRUE(connection.PeerSend(std::string(sizeof buffer + static_cast<std::size_t>(test.more), 'x')));
        EXPECT_FALSE(server->Receive(connection.Server(), buffer, sizeof buffer));
        EXPECT_EQ(test.left, connection.Server().BytesAvailable()) << test.more;
        EXPECT_EQ(TOO_LARGE, LastMessage());
    }
}

TEST_F(RemoteService, ResetIsReportedAsSuch) {
    for (const char* before : {"", "0|do"}) {
        FakeService service([before](Peer& peer, const std::string&) {
            peer.Send(before);
            peer.Abort();
        });
        UseService(service.Address());
        EXPECT_EQ("-256|", Ask());
        EXPECT_EQ((Lines{Disconnected(ECONNRESET), UNABLE_TO_RECEIVE}), Messages());
    }
}

TEST_F(RemoteService, OtherErrorsOfReceiving) {
    static int s_error = 0;
    const Injected recv(
        oxSocket::m_lpfnrecv, +[](int, void*, std::size_t, int) -> ssize_t {
            errno = s_error;
            return -1;
        });
    UseService("127.0.0.1:1");
    for (const int error : {ECONNABORTED, ECONNRESET, ETIMEDOUT, ENOTCONN}) {
        s_error = error;
        Connection connection;
        ASSERT_TRUE(connection.PeerSend("0|x|EOT"));
        ForgetMessages();
        EXPECT_EQ("-256|", Process(connection.Server()));
        const bool disconnected = error == ECONNABORTED || error == ECONNRESET;
        EXPECT_EQ((Lines{disconnected ? Disconnected(error) : ReceiveFailed(error), UNABLE_TO_RECEIVE}), Messages());
    }
}

TEST_F(RemoteService, LinesOfTheAnswerHaveLevelOne) {
    oxAuditFile::SetDefaultDebugLevel(1);
    server = std::make_unique<oxxHttpServer>(nullptr, clock);
    FakeService service("nonsense");
    UseService(service.Address());
    EXPECT_EQ("-256|", Ask());
    EXPECT_EQ(Lines{UNABLE_TO_PARSE}, Messages());
}

TEST_F(RemoteService, RefusedConnectionIsReported) {
    UseService("127.0.0.1:" + std::to_string(FreePort()));
    EXPECT_EQ("-256|", Ask());
    EXPECT_EQ(Lines{ConnectFailed(ECONNREFUSED, "Connection refused")}, Messages());
}

TEST_F(RemoteService, AddressThatIsNoneIsAFailedConnect) {
    for (const char* address : {"nonsense", "0", "127.0.0.1:", "127.0.0.1:0", "127.0.0.1:65536", "127.0.0.1:-80",
                                "127.0.0.1:http", ":8080", ":"}) {
        UseService(address);
        EXPECT_EQ("-256|", Ask()) << address;
        EXPECT_EQ(Lines{ConnectFailed(EDESTADDRREQ, "Destination address required")}, Messages()) << address;
    }
}

TEST_F(RemoteService, HostThatIsNotFoundIsAFailedConnect) {
    const Injected noHosts(
        oxSocket::m_lpfngethostbyname, +[](const char*) -> hostent* { return nullptr; });
    UseService("no-such-host:8080");
    EXPECT_EQ("-256|", Ask());
    ASSERT_EQ(1u, Messages().size());
    EXPECT_TRUE(LastMessage().starts_with("oxxHttpServer::SendERSRequest : connect failed - socket error = "));
}

TEST_F(RemoteService, HostIsLookedUpByName) {
    const Injected hosts(
        oxSocket::m_lpfngethostbyname, +[](const char* name) -> hostent* {
            static char s_address[4] = {127, 0, 0, 1};
            static char* s_list[] = {s_address, nullptr};
            static hostent s_entry{
                .h_name = nullptr, .h_aliases = nullptr, .h_addrtype = AF_INET, .h_length = 4, .h_addr_list = s_list};
            return std::strcmp(name, "the-service") == 0 ? &s_entry : nullptr;
        });
    FakeService service("0|done|EOT");
    UseService("the-service:" + std::to_string(service.Port()));
    EXPECT_EQ("0|done", Ask());
}

TEST_F(RemoteService, OwnNameThatIsNotFoundIsThisMachineAllTheSame) {
    const Injected noHosts(
        oxSocket::m_lpfngethostbyname, +[](const char*) -> hostent* { return nullptr; });
    FakeService service("0|done|EOT");
    UseService(std::to_string(service.Port()));
    EXPECT_EQ("0|done", Ask());
}

TEST_F(RemoteService, SocketThatCannotBeMadeIsAFailedConnect) {
    const Injected noSockets(
        oxSocket::m_lpfnsocket, +[](int, int, int) {
            errno = EMFILE;
            return -1;
        });
    UseService("127.0.0.1:1");
    EXPECT_EQ("-256|", Ask());
    EXPECT_EQ(Lines{ConnectFailed(EMFILE, "Too many open files")}, Messages());
}

TEST_F(RemoteService, InvalidSocketIsUnreachableWithoutALine) {
    UseService("127.0.0.1:1");
    oxSocket socket;
    EXPECT_EQ("-256|", Process(socket));
    EXPECT_EQ(Lines{}, Messages());
}

TEST_F(RemoteService, CloseByAnotherThreadEndsTheWait) {
    UseService("127.0.0.1:1");
    Connection connection;
    std::string result;
    std::thread asker([&] { result = Process(connection.Server()); });
    connection.Server().Close();
    asker.join();
    EXPECT_EQ("-256|", result);
    EXPECT_EQ(Lines{}, Messages());
}

TEST_F(RemoteService, LargeRequestGoesOutWhole) {
    FakeService service("0|done|EOT");
    UseService(service.Address());
    const std::string argument(8 * 1024 * 1024, 'a');
    EXPECT_EQ("0|done", Ask("ctx", 1, argument));
    ASSERT_EQ(1u, service.Requests().size());
    EXPECT_TRUE("ctx|1|" + argument + "|EOT" == service.Requests()[0]);
}

TEST_F(RemoteService, ConnectionSendsAtOnceAndMayReuseItsAddress) {
    static int s_noDelay = 0;
    static int s_reuse = 0;
    s_noDelay = s_reuse = 0;
    const Injected connect(
        oxSocket::m_lpfnconnect, +[](int socket, const sockaddr* address, socklen_t length) {
            socklen_t size = sizeof s_noDelay;
            EXPECT_EQ(0, ::getsockopt(socket, IPPROTO_TCP, TCP_NODELAY, &s_noDelay, &size));
            EXPECT_EQ(0, ::getsockopt(socket, SOL_SOCKET, SO_REUSEADDR, &s_reuse, &size));
            return ::connect(socket, address, length);
        });
    FakeService service("0|done|EOT");
    UseService(service.Address());
    EXPECT_EQ("0|done", Ask());
    EXPECT_NE(0, s_noDelay);
    EXPECT_NE(0, s_reuse);
}

TEST_F(RemoteService, ServiceThatAnswersWithoutReadingIsHeard) {
    FakeService service(
        [](Peer& peer, const std::string&) {
            EXPECT_TRUE(peer.Send("3|busy|EOT"));
            EXPECT_TRUE(peer.WaitForEnd());
        },
        false);
    UseService(service.Address());
    EXPECT_EQ("3|busy", Ask());
}

TEST_F(RemoteService, AnyDescriptorNumberWorks) {
    static constexpr int HIGH = 1500;  // above what select can take
    rlimit before{};
    ASSERT_EQ(0, ::getrlimit(RLIMIT_NOFILE, &before));
    const rlimit raised{.rlim_cur = std::max<rlim_t>(before.rlim_cur, HIGH + 1), .rlim_max = before.rlim_max};
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &raised));
    {
        const Injected high(
            oxSocket::m_lpfnsocket, +[](int family, int type, int protocol) {
                const UniqueFd low(::socket(family, type, protocol));
                return ::fcntl(low.Get(), F_DUPFD_CLOEXEC, HIGH);
            });
        FakeService service("0|done|EOT");
        UseService(service.Address());
        EXPECT_EQ("0|done", Ask());
    }
    EXPECT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &before));
}

TEST_F(RemoteService, ThreadsGetTheirOwnAnswers) {
    FakeService service([](Peer& peer, const std::string& request) {
        peer.Send("0|" + request.substr(0, request.find('|')) + "|EOT");
    });
    UseService(service.Address());
    std::vector<std::jthread> threads;
    for (int thread = 0; thread < 8; ++thread)
        threads.emplace_back([this, thread] {
            for (int i = 0; i < 20; ++i) {
                const std::string name = "thread " + std::to_string(thread) + " request " + std::to_string(i);
                EXPECT_EQ("0|" + name, Ask(name));
            }
        });
    threads.clear();
    EXPECT_EQ(Lines{}, Messages());
}

// The rest waits for time-outs, the shortest of which is a second.

TEST_F(RemoteService, SilentServiceIsGivenUpAfterAllRetriesWithoutALine) {
    FakeService service([](Peer& peer, const std::string&) { EXPECT_TRUE(peer.WaitForEnd()); });
    UseService(service.Address(), 1, 2);
    const auto start = steady_clock::now();
    EXPECT_EQ("-256|", Ask());
    const auto taken = steady_clock::now() - start;
    EXPECT_GE(taken, seconds(2));
    EXPECT_LT(taken, seconds(10));
    EXPECT_EQ(Lines{}, Messages());
}

// Each set-up stands for a reset.
TEST_F(RemoteService, ChangedPatienceCountsFromTheNextSetUpOn) {
    FakeService service([](Peer& peer, const std::string&) { EXPECT_TRUE(peer.WaitForEnd()); });
    UseService(service.Address(), 600, 600);
    static const struct {
        int timeout;
        int retries;
    } CASES[] = {{1, 1}, {1, 2}, {2, 1}};
    for (const auto& c : CASES) {
        UseService(service.Address(), c.timeout, c.retries);
        const auto start = steady_clock::now();
        EXPECT_EQ("-256|", Ask());
        const auto taken = steady_clock::now() - start;
        EXPECT_GE(taken, seconds(c.timeout * c.retries));
        EXPECT_LT(taken, seconds(60)) << c.timeout << "*" << c.retries;
    }
}

TEST_F(RemoteService, HalfAnAnswerIsGivenUp) {
    FakeService service([](Peer& peer, const std::string&) {
        EXPECT_TRUE(peer.Send("0|do"));
        EXPECT_TRUE(peer.WaitForEnd());
    });
    UseService(service.Address(), 1);
    const auto start = steady_clock::now();
    EXPECT_EQ("-256|", Ask());
    EXPECT_GE(steady_clock::now() - start, seconds(1));
    EXPECT_EQ((Lines{ReceiveFailed(EAGAIN), UNABLE_TO_RECEIVE}), Messages());
}

TEST_F(RemoteService, AnswerThatTricklesIsGivenUp) {
    FakeService service([](Peer& peer, const std::string&) {
        EXPECT_TRUE(peer.Send("0|"));
        while (!peer.WaitForEnd(100) && peer.Send("x"))
            ;
    });
    UseService(service.Address(), 1);
    const auto start = steady_clock::now();
    EXPECT_EQ("-256|", Ask());
    EXPECT_GE(steady_clock::now() - start, seconds(1));
    EXPECT_LT(steady_clock::now() - start, seconds(10));
    EXPECT_EQ((Lines{ReceiveFailed(EAGAIN), UNABLE_TO_RECEIVE}), Messages());
}

TEST_F(RemoteService, SlowAnswerWithinTheTimeIsGood) {
    FakeService service([](Peer& peer, const std::string&) {
        for (const char c : std::string("0|slow|EOT")) {
            EXPECT_FALSE(peer.WaitForEnd(20));
            EXPECT_TRUE(peer.Send({&c, 1}));
        }
        EXPECT_TRUE(peer.WaitForEnd());
    });
    UseService(service.Address());
    EXPECT_EQ("0|slow", Ask());
}

TEST_F(RemoteService, ServiceThatReadsNothingIsGivenUp) {
    std::atomic<bool> done{false};
    FakeService service([&](Peer&, const std::string&) { EXPECT_TRUE(Eventually([&] { return done.load(); })); }, false,
                        4096);
    UseService(service.Address(), 1);
    const auto start = steady_clock::now();
    EXPECT_EQ("-256|", Ask("ctx", 1, std::string(32 * 1024 * 1024, 'a')));
    done = true;
    EXPECT_LT(steady_clock::now() - start, seconds(20));
    EXPECT_EQ(Lines{}, Messages());
}

TEST_F(RemoteService, ConnectionThatIsNotAnsweredIsGivenUp) {
    // The queue of a listener that accepts nobody takes one connection; what comes later gets no answer.
    UniqueFd listener(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    auto* raw = reinterpret_cast<sockaddr*>(&address);
    ASSERT_EQ(0, ::bind(listener.Get(), raw, length));
    ASSERT_EQ(0, ::listen(listener.Get(), 0));
    ASSERT_EQ(0, ::getsockname(listener.Get(), raw, &length));
    const Client first(ntohs(address.sin_port));
    ASSERT_TRUE(first.Connected());

    UseService("127.0.0.1:" + std::to_string(ntohs(address.sin_port)), 1);
    const auto start = steady_clock::now();
    EXPECT_EQ("-256|", Ask());
    EXPECT_GE(steady_clock::now() - start, seconds(1));
    EXPECT_EQ(Lines{ConnectFailed(ETIMEDOUT, "Connection timed out")}, Messages());
}
