#include "protocol/request.h"

#include <gtest/gtest.h>

#include <memory>
#include <new>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "protocol/testsockets.h"

using namespace std::string_literals;

namespace {

// What a request was read and taken apart to.
struct Outcome {
    bool good = false;
    int status = 0;
    int method = 0;
    std::string rawPath{};
    std::string path{};
    std::string extension{};
    std::string query{};
    std::string version{};
    int major = 0;
    int minor = 0;
    std::string since{};
    std::string agent{};
    std::string user{};
    std::string password{};
    std::string body{};
    std::uint32_t length = 0;

    bool operator==(const Outcome&) const = default;
};

std::ostream& operator<<(std::ostream& out, const Outcome& o) {
    return out << "good=" << o.good << " status=" << o.status << " method=" << o.method << " raw=[" << o.rawPath
               << "] path=[" << o.path << "] ext=[" << o.extension << "] query=[" << o.query << "] version=["
               << o.version << "] " << o.major << "." << o.minor << " since=[" << o.since << "] agent=[" << o.agent
               << "] user=[" << o.user << "] password=[" << o.password << "] body=[" << o.body
               << "] length=" << o.length;
}

Outcome Collect(bool good, const oxRequest& request) {
    return {good,
            request.GetStatus(),
            request.GetMethod(),
            std::string(request.GetRawPath()),
            request.GetPath(),
            request.GetExtension(),
            request.GetQueryString(),
            request.GetVersionText(),
            request.GetVersionMajor(),
            request.GetVersionMinor(),
            request.GetIfModifiedSince(),
            request.GetUserAgent(),
            request.GetUser(),
            request.GetPassword(),
            std::string(request.GetBody()),
            request.GetContentLength()};
}

// Reads what comes on the connection into a request whose memory is full of a text that would change every field if it
// were looked at.
Outcome ReadAndParse(Connection& connection, LineLog& log) {
    static constexpr std::string_view poison = " HTTP/1.1\r\nUser-Agent: old\r\nContent-Length: 3\r\n\r\nold /old?old";
    struct alignas(oxRequest) Memory {
        char bytes[sizeof(oxRequest)];
    };
    const auto memory = std::make_unique<Memory>();
    for (std::size_t i = 0; i < sizeof memory->bytes; ++i)
        memory->bytes[i] = poison[i % poison.size()];
    asm volatile("" : : "r"(memory->bytes) : "memory");  // the compiler must not take the filling for dead
    const std::unique_ptr<oxRequest, void (*)(oxRequest*)> request(new (memory->bytes) oxRequest,
                                                                   [](oxRequest* r) { r->~oxRequest(); });
    const bool good = request->Read(connection.Server(), log) && request->Parse();
    return Collect(good, *request);
}

// The outcome of a text that arrives in these pieces, each by itself, and then the end.
Outcome Feed(const std::vector<std::string_view>& pieces) {
    Connection connection(Connection::PIECES);
    LineLog log;
    const auto send = [&] {
        for (const std::string_view piece : pieces)
            connection.PeerSend(piece);
        connection.PeerEnd();
    };
    // A few pieces need no reader to make room.
    std::optional<std::jthread> sender;
    if (pieces.size() > 2)
        sender.emplace(send);
    else
        send();
    const Outcome outcome = ReadAndParse(connection, log);
    EXPECT_TRUE(log.Lines().empty()) << log.Lines().front();
    connection.Server().Close();  // a sender that is not done gives up
    return outcome;
}

Outcome Whole(std::string_view text) {
    return Feed({text});
}

struct Case {
    std::string name;
    std::string text;
    Outcome expected;
};

const std::string HEAD = "GET /x HTTP/1.0\r\n";

Outcome Bad(int method = 0, std::string raw = {}, std::string path = {}, std::string extension = {}) {
    return {.status = -4,
            .method = method,
            .rawPath = std::move(raw),
            .path = std::move(path),
            .extension = std::move(extension)};
}

Outcome Get(std::string raw, std::string path, std::string extension = {}, std::string query = {}) {
    return {.good = true,
            .method = 1,
            .rawPath = std::move(raw),
            .path = std::move(path),
            .extension = std::move(extension),
            .query = std::move(query),
            .version = "HTTP/1.0",
            .major = 1};
}

Outcome GetUrl(std::string url) {
    return Get(url, url);
}

// Bad behind the version.
Outcome BadLine() {
    Outcome outcome = GetUrl("/x");
    outcome.good = false;
    outcome.status = -4;
    return outcome;
}

Outcome Method(Outcome outcome, int method) {
    outcome.method = method;
    return outcome;
}

Outcome With(Outcome outcome, std::string Outcome::*field, std::string value) {
    outcome.*field = std::move(value);
    return outcome;
}

Outcome Version(std::string text, int majorNumber, int minorNumber) {
    Outcome outcome = GetUrl("/x");
    outcome.version = std::move(text);
    outcome.major = majorNumber;
    outcome.minor = minorNumber;
    return outcome;
}

Outcome Login(std::string user, std::string password) {
    Outcome outcome = GetUrl("/x");
    outcome.user = std::move(user);
    outcome.password = std::move(password);
    return outcome;
}

Outcome Post(std::string raw, std::string query, std::string body) {
    Outcome outcome = GetUrl(std::move(raw));
    outcome.method = 3;
    outcome.query = std::move(query);
    outcome.length = static_cast<std::uint32_t>(body.size());
    outcome.body = std::move(body);
    return outcome;
}

std::vector<Case> Cases() {
    std::vector<Case> cases = {
        {"Plain", "GET / HTTP/1.0\r\n\r\n", GetUrl("/")},
        {"Query", "get /index.html?a=b HTTP/1.0\r\n\r\n", Get("/index.html", "/index.html", "html", "a=b")},
        {"SecondQuestionMark", "GET /x?a?b HTTP/1.0\r\n\r\n", Get("/x", "/x", "", "a?b")},
        {"EmptyQuery", "GET /x? HTTP/1.0\r\n\r\n", GetUrl("/x")},
        {"QueryIsNotDecoded", "GET /x?a=%41+b HTTP/1.0\r\n\r\n", Get("/x", "/x", "", "a=%41+b")},
        {"LeadingSpaces", "   GET    /x HTTP/1.0\r\n\r\n", GetUrl("/x")},
        {"LeadingLineEnd", "\r\nGET /x HTTP/1.0\r\n\r\n", Bad()},
        // Methods: what begins a method's name is that method.
        {"MethodG", "G /x HTTP/1.0\r\n\r\n", GetUrl("/x")},
        {"MethodGe", "gE /x HTTP/1.0\r\n\r\n", GetUrl("/x")},
        {"MethodHead", "HEAD /x HTTP/1.0\r\n\r\n", Method(GetUrl("/x"), 2)},
        {"MethodH", "h /x HTTP/1.0\r\n\r\n", Method(GetUrl("/x"), 2)},
        {"MethodP", "P /x HTTP/1.0\r\n\r\n", Post("/x", "", "")},
        {"MethodTooLong", "GETS /x HTTP/1.0\r\n\r\n", Bad()},
        {"MethodDelete", "DELETE /x HTTP/1.0\r\n\r\n", Bad()},
        {"Garbage", "garbage\r\n\r\n", Bad()},
        {"OnlySpaces", "   ", Bad(1)},
        {"Empty", "", Bad()},
        {"NulOnly", "\0"s, Bad()},
        // URLs.
        {"NoSlash", "GET index.html HTTP/1.0\r\n\r\n", Bad(1)},
        {"AbsoluteUrl", "GET http://h/x HTTP/1.0\r\n\r\n", Bad(1)},
        {"NoUrl", "GET \r\n\r\n", Bad(1)},
        {"Decoded", "GET /a%2Fb%zz HTTP/1.0\r\n\r\n", Get("/a%2Fb%zz", "/a/b%zz")},
        {"DecodedOnce", "GET /%2541%25zz HTTP/1.0\r\n\r\n", Get("/%2541%25zz", "/%41%zz")},
        {"CutEscapes", "GET /%%%4%41%4 HTTP/1.0\r\n\r\n", Get("/%%%4%41%4", "/%%%4A%4")},
        {"PercentLast", "GET /% HTTP/1.0\r\n\r\n", GetUrl("/%")},
        {"HexCase", "GET /%aF%Af HTTP/1.0\r\n\r\n", Get("/%aF%Af", "/\xaf\xaf")},
        {"PlusStays", "GET /a+b HTTP/1.0\r\n\r\n", GetUrl("/a+b")},
        {"EscapedQuestionMark", "GET /a%3fb?c HTTP/1.0\r\n\r\n", Get("/a%3fb", "/a?b", "", "c")},
        {"NulEndsPath", "GET /x.pl%00.htm HTTP/1.0\r\n\r\n", Get("/x.pl%00.htm", "/x.pl", "pl")},
        {"NulEndsPathBeforeDot", "GET /default%00.pl?q HTTP/1.0\r\n\r\n", Get("/default%00.pl", "/default", "", "q")},
        {"ExtensionOfDirectory", "GET /a.b/c HTTP/1.0\r\n\r\n", Get("/a.b/c", "/a.b/c", "b/c")},
        {"ExtensionLastDot", "GET /a.b.c HTTP/1.0\r\n\r\n", Get("/a.b.c", "/a.b.c", "c")},
        {"ExtensionEmpty", "GET /a. HTTP/1.0\r\n\r\n", GetUrl("/a.")},
        {"ExtensionDecoded", "GET /a%2epl HTTP/1.0\r\n\r\n", Get("/a%2epl", "/a.pl", "pl")},
        // The end of the request line.
        {"NoVersion", "GET /x\r\n\r\n", Bad(1, "/x", "/x")},
        {"NoVersionOneSpace", "GET /x \r\n\r\n", With(Version("", 0, 0), &Outcome::version, "")},
        {"TwoSpacesBeforeVersion", "GET /x  HTTP/1.0\r\n\r\n", Bad(1, "/x", "/x")},
        {"SpacesBehindVersion", "GET /x HTTP/1.0   \r\n\r\n", GetUrl("/x")},
        {"TextBehindVersion", "GET /x HTTP/1.0 more\r\n\r\n", BadLine()},
        {"BareLineFeed", "GET /x HTTP/1.0\n\r\n\r\n", BadLine()},
        {"BareReturn", "GET /x HTTP/1.0\rX\r\n\r\n", BadLine()},
        // Ended by the end of the connection: nothing behind the text is looked at.
        {"EndBehindMethod", "GET", Bad(1)},
        {"EndBehindMethodSpace", "GET ", Bad(1)},
        {"EndBehindUrl", "GET /x", Version("", 0, 0)},
        {"EndBehindUrlSpace", "GET /x ", Version("", 0, 0)},
        {"EndBehindUrlSpaces", "GET /x  ", Bad(1, "/x", "/x")},
        {"EndBehindVersion", "GET /x HTTP/1.0", GetUrl("/x")},
        {"EndBehindVersionSpace", "GET /x HTTP/1.0 ", BadLine()},
        {"EndBehindReturn", "GET /x HTTP/1.0\r", BadLine()},
        {"EndBehindUrlReturn", "GET /x\r", Version("", 0, 0)},
        {"EndBehindUrlLine", "GET /x\r\n", Bad(1, "/x", "/x")},
        {"EndBehindLine", HEAD, GetUrl("/x")},
        {"EndInHeader", HEAD + "User-Agent: a", With(GetUrl("/x"), &Outcome::agent, "a")},
        {"EndBehindHeaderName", HEAD + "User-Agent", GetUrl("/x")},
        {"EndBehindColon", HEAD + "User-Agent:", GetUrl("/x")},
        // A NUL ends the text.
        {"NulInMethod", "G\0ET /x HTTP/1.0\r\n\r\n"s, Bad(1)},
        {"NulInUrl", "GET /x\0y HTTP/1.0\r\n\r\n"s, Bad(1, "/x", "/x")},
        {"NulInVersion", "GET /x HTTP/1\0.0\r\n\r\n"s, Bad(1, "/x", "/x")},
        {"NulBehindVersion", "GET /x HTTP/1.0\0\r\n\r\n"s, BadLine()},
        {"NulBeforeHeader", HEAD + "X: \0\r\nUser-Agent: a\r\n\r\n"s, GetUrl("/x")},
        {"NulInHeader", HEAD + "User-Agent: a\0b\r\n\r\n"s, With(GetUrl("/x"), &Outcome::agent, "a")},
        {"NulBeforeLength", "POST /x HTTP/1.0\r\nX: \0\r\nContent-Length: 3\r\n\r\nabc"s, Post("/x", "", "")},
        // Versions.
        {"Version11", "GET /x HTTP/1.1\r\n\r\n", Version("HTTP/1.1", 1, 1)},
        {"VersionCase", "GET /x hTtP/2.7\r\n\r\n", Version("hTtP/2.7", 2, 7)},
        {"VersionLong", "GET /x HTTP/1.1x\r\n\r\n", Version("", 0, 0)},
        {"VersionShort", "GET /x HTTP/1.\r\n\r\n", Version("", 0, 0)},
        {"VersionOther", "GET /x HTTQ/1.0\r\n\r\n", Version("", 0, 0)},
        {"VersionLetters", "GET /x HTTP/a.b\r\n\r\n", Version("HTTP/a.b", 0, 0)},
        {"VersionThreeDigits", "GET /x HTTP/123\r\n\r\n", Version("HTTP/123", 123, 3)},
        {"VersionSign", "GET /x HTTP/-12\r\n\r\n", Version("HTTP/-12", -12, 2)},
        // Headers.
        {"Since", HEAD + "If-Modified-Since: Sun, 06 Nov 1994 08:49:37 GMT\r\n\r\n",
         With(GetUrl("/x"), &Outcome::since, "Sun, 06 Nov 1994 08:49:37 GMT")},
        {"Agent", HEAD + "User-Agent: a b\r\nX: y\r\n\r\n", With(GetUrl("/x"), &Outcome::agent, "a b")},
        {"NoSpace", HEAD + "User-Agent:a\r\n\r\n", With(GetUrl("/x"), &Outcome::agent, "a")},
        {"OneSpaceSkipped", HEAD + "User-Agent:  a \r\n\r\n", With(GetUrl("/x"), &Outcome::agent, " a ")},
        {"LineFeedEndsValue", HEAD + "User-Agent: a\nb\r\n\r\n", With(GetUrl("/x"), &Outcome::agent, "a")},
        {"EmptyValue", HEAD + "User-Agent: \r\n\r\n", GetUrl("/x")},
        {"LowerCaseName", HEAD + "user-agent: a\r\n\r\n", GetUrl("/x")},
        {"SpaceBeforeColon", HEAD + "User-Agent : a\r\n\r\n", GetUrl("/x")},
        {"OnlyFirstName", HEAD + "User-Agent-X: b\r\nUser-Agent: a\r\n\r\n", GetUrl("/x")},
        {"TailOfOtherName", HEAD + "X-User-Agent: x\r\nUser-Agent: a\r\n\r\n",
         With(GetUrl("/x"), &Outcome::agent, "x")},
        {"NameInOtherValue", HEAD + "Referer: User-Agent:r\r\nUser-Agent: a\r\n\r\n",
         With(GetUrl("/x"), &Outcome::agent, "r")},
        {"NameInUrl", "GET /User-Agent: HTTP/1.0\r\nUser-Agent: a\r\n\r\n",
         With(GetUrl("/User-Agent:"), &Outcome::agent, "a")},
        {"NotInBody", "POST /x HTTP/1.0\r\nContent-Length: 40\r\n\r\n\r\nAuthorization: Basic YW5uOnB3\r\nUser-Ag",
         Post("/x", "\r\nAuthorization: Basic YW5uOnB3\r\nUser-Ag", "\r\nAuthorization: Basic YW5uOnB3\r\nUser-Ag")},
        // Credentials.
        {"Basic", HEAD + "Authorization: Basic YW5uOnB3\r\n\r\n", Login("ann", "pw")},
        {"BasicSpaces", HEAD + "Authorization:Basic    YW5uOnB3\r\n\r\n", Login("ann", "pw")},
        {"BasicLowerCase", HEAD + "Authorization: basic YW5uOnB3\r\n\r\n", GetUrl("/x")},
        {"BasicNoColon", HEAD + "Authorization: Basic YW5u\r\n\r\n", Login("ann", "")},
        {"BasicNothing", HEAD + "Authorization: Basic\r\n\r\n", GetUrl("/x")},
        {"OtherScheme", HEAD + "Authorization: Digest YW5uOnB3\r\n\r\n", GetUrl("/x")},
        {"ProxyFirst", HEAD + "Proxy-Authorization: Basic YTpi\r\nAuthorization: Basic YW5uOnB3\r\n\r\n",
         Login("a", "b")},
        // Bodies.
        {"Body", "POST /run HTTP/1.0\r\nContent-Length: 5\r\n\r\nx=1&y", Post("/run", "x=1&y", "x=1&y")},
        {"BodyAndQuery", "POST /run?z=2 HTTP/1.0\r\nContent-Length: 5\r\n\r\nx=1&y", Post("/run", "z=2", "x=1&y")},
        {"BodyAndEmptyQuery", "POST /run? HTTP/1.0\r\nContent-Length: 5\r\n\r\nx=1&y", Post("/run", "", "x=1&y")},
        {"BodyOfGet", "GET /run HTTP/1.0\r\nContent-Length: 5\r\n\r\nx=1&y", Method(Post("/run", "", "x=1&y"), 1)},
        {"BodyMore", "POST /run HTTP/1.0\r\nContent-Length: 3\r\n\r\nx=1&y", Post("/run", "x=1", "x=1")},
        {"BodyCut", "POST /run HTTP/1.0\r\nContent-Length: 6\r\n\r\nx=1&y", Post("/run", "", "")},
        {"BodyNul", "POST /run HTTP/1.0\r\nContent-Length: 5\r\n\r\n\0\r\n\0y"s,
         Post("/run", "\0\r\n\0y"s, "\0\r\n\0y"s)},
        {"BodyBlankLine", "POST /run HTTP/1.0\r\nContent-Length: 5\r\n\r\n\r\n\r\nx",
         Post("/run", "\r\n\r\nx", "\r\n\r\nx")},
        {"NoLength", "POST /run HTTP/1.0\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthOnlyBehindHeaders", "POST /run HTTP/1.0\r\n\r\nContent-Length: 3", Post("/run", "", "")},
        {"LengthSecondSpelling", "POST /run HTTP/1.0\r\nContent-length: 5\r\n\r\nx=1&y",
         Post("/run", "x=1&y", "x=1&y")},
        {"LengthLowerCase", "POST /run HTTP/1.0\r\ncontent-length: 5\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthNoSpace", "POST /run HTTP/1.0\r\nContent-Length:5\r\n\r\nx=1&y", Post("/run", "x=1&y", "x=1&y")},
        {"LengthTwoSpaces", "POST /run HTTP/1.0\r\nContent-Length:  5\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthMinus", "POST /run HTTP/1.0\r\nContent-Length: -5\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthZero", "POST /run HTTP/1.0\r\nContent-Length: 0\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthEmpty", "POST /run HTTP/1.0\r\nContent-Length:\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthNothing", "POST /run HTTP/1.0\r\nContent-Length\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthText", "POST /run HTTP/1.0\r\nContent-Length: five\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthDigitsThenText", "POST /run HTTP/1.0\r\nContent-Length: 3;q\r\n\r\nx=1&y", Post("/run", "x=1", "x=1")},
        {"LengthLeadingZeros", "POST /run HTTP/1.0\r\nContent-Length: 000000000000000000005\r\n\r\nx=1&y",
         Post("/run", "x=1&y", "x=1&y")},
        {"LengthAnyCharacterForColon", "POST /run HTTP/1.0\r\nContent-Length=5\r\n\r\nx=1&y",
         Post("/run", "x=1&y", "x=1&y")},
        {"LengthFirstWins", "POST /run HTTP/1.0\r\nContent-Length: 3\r\nContent-Length: 5\r\n\r\nx=1&y",
         Post("/run", "x=1", "x=1")},
        {"LengthFirstSpellingWins", "POST /run HTTP/1.0\r\nContent-length: 5\r\nContent-Length: 3\r\n\r\nx=1&y",
         Post("/run", "x=1", "x=1")},
        {"LengthTailOfOtherName", "POST /run HTTP/1.0\r\nX-Content-Length: 3\r\nContent-Length: 5\r\n\r\nx=1&y",
         Post("/run", "x=1", "x=1")},
        // Numbers that would wrap to a small one.
        {"LengthWraps32", "POST /run HTTP/1.0\r\nContent-Length: 4294967301\r\n\r\nx=1&y", Post("/run", "", "")},
        {"LengthWraps64", "POST /run HTTP/1.0\r\nContent-Length: 18446744073709551621\r\n\r\nx=1&y",
         Post("/run", "", "")},
        // The first spelling counts wherever it stands, in the body too: then there is no body.
        {"FirstSpellingInBody",
         "POST /run HTTP/1.0\r\nContent-length: 16\r\n\r\nxContent-Length:", Post("/run", "", "")},
        {"FirstSpellingInBodyBehindNul", "POST /run HTTP/1.0\r\nContent-length: 16\r\n\r\n\0Content-Length:"s,
         Post("/run", "\0Content-Length:"s, "\0Content-Length:"s)},
        {"FirstSpellingBehindBody", "POST /run HTTP/1.0\r\nContent-length: 1\r\n\r\nxContent-Length: 3",
         Post("/run", "x", "x")},
        {"BothSpellingsAndBody", "POST /run HTTP/1.0\r\nContent-Length: 16\r\n\r\nxContent-Length:",
         Post("/run", "xContent-Length:", "xContent-Length:")},
    };
    return cases;
}

TEST(OxRequest, Table) {
    for (const Case& c : Cases())
        EXPECT_EQ(c.expected, Whole(c.text)) << c.name;
}

TEST(OxRequest, TableCutAtEveryByte) {
    for (const Case& c : Cases()) {
        const std::string_view text = c.text;
        for (std::size_t at = 1; at < text.size(); ++at)
            ASSERT_EQ(c.expected, Feed({text.substr(0, at), text.substr(at)})) << c.name << " cut at " << at;
    }
}

TEST(OxRequest, TableOneByteAtATime) {
    for (const Case& c : Cases()) {
        std::vector<std::string_view> pieces;
        for (std::size_t at = 0; at < c.text.size(); ++at)
            pieces.push_back(std::string_view(c.text).substr(at, 1));
        EXPECT_EQ(c.expected, Feed(pieces)) << c.name;
    }
}

TEST(OxRequest, IsEmptyAtFirst) {
    const oxRequest request;
    EXPECT_EQ(Outcome{}, Collect(false, request));
    EXPECT_STREQ("", request.GetMethodName());
    EXPECT_FALSE(request.IsComplete());
}

TEST(OxRequest, ParseOfNothingIsBad) {
    oxRequest request;
    EXPECT_FALSE(request.Parse());
    EXPECT_EQ(oxRequest::STATUS_BAD, request.GetStatus());
    EXPECT_FALSE(request.Parse());
}

TEST(OxRequest, ParseAfterAFailedReadLeavesItsStatus) {
    Connection connection;
    LineLog log;
    oxRequest request;
    ASSERT_TRUE(connection.PeerSend(HEAD + "X: " + std::string(40000, 'x')));
    ASSERT_FALSE(request.Read(connection.Server(), log));
    EXPECT_FALSE(request.Parse());
    EXPECT_EQ(Outcome{.status = -3}, Collect(false, request));
}

// A request object takes one connection after the other: nothing of the last one is left in a bad one.
TEST(OxRequest, SecondRequestThatIsBadHasNoPathAndNoQuery) {
    for (const char* second : {"BREW /c?d HTTP/1.0\r\n\r\n", "GET c?d HTTP/1.0\r\n\r\n", "GET\r\n\r\n"}) {
        LineLog log;
        oxRequest request;
        Connection first;
        ASSERT_TRUE(first.PeerSend("GET /a?b HTTP/1.0\r\n\r\n"));
        ASSERT_TRUE(request.Read(first.Server(), log) && request.Parse());
        EXPECT_EQ("/a", request.GetPath());
        EXPECT_EQ("b", request.GetQueryString());
        Connection next;
        ASSERT_TRUE(next.PeerSend(second));
        ASSERT_TRUE(request.Read(next.Server(), log));
        EXPECT_FALSE(request.Parse()) << second;
        EXPECT_EQ(oxRequest::STATUS_BAD, request.GetStatus()) << second;
        EXPECT_EQ("", request.GetPath()) << second;
        EXPECT_EQ("", request.GetQueryString()) << second;
    }
}

TEST(OxRequest, WhatIsNotThereIsNull) {
    const struct {
        const char* text;
        bool hasUrl;
        bool hasBody;
    } cases[] = {
        {"POST /run HTTP/1.0\r\nContent-Length: 1\r\n\r\nx", true, true},
        {"POST /run HTTP/1.0\r\nContent-Length: 0\r\n\r\nx", true, false},
        {"POST /run HTTP/1.0\r\n\r\nx", true, false},
        {"GET index.html HTTP/1.0\r\n\r\n", false, false},
        {"BREW /c HTTP/1.0\r\n\r\n", false, false},
    };
    for (const auto& c : cases) {
        Connection connection;
        LineLog log;
        oxRequest request;
        ASSERT_TRUE(connection.PeerSend(c.text));
        ASSERT_TRUE(request.Read(connection.Server(), log));
        request.Parse();
        EXPECT_EQ(c.hasUrl, request.GetRawPath().data() != nullptr) << c.text;
        EXPECT_EQ(c.hasBody, request.GetBody().data() != nullptr) << c.text;
    }
}

TEST(OxRequest, MethodNames) {
    const struct {
        const char* text;
        const char* name;
    } cases[] = {
        {"g / x\r\n\r\n", "GET"}, {"he / x\r\n\r\n", "HEAD"}, {"pos / x\r\n\r\n", "POST"}, {"x / x\r\n\r\n", ""}};
    for (const auto& c : cases) {
        Connection connection;
        LineLog log;
        oxRequest request;
        ASSERT_TRUE(connection.PeerSend(c.text));
        ASSERT_TRUE(request.Read(connection.Server(), log));
        request.Parse();
        EXPECT_STREQ(c.name, request.GetMethodName()) << c.text;
    }
}

TEST(OxRequest, PathOf8191CharactersIsTheLongest) {
    const std::string path = "/" + std::string(8190, 'a');
    EXPECT_EQ(GetUrl(path), Whole("GET " + path + " HTTP/1.0\r\n\r\n"));
    EXPECT_EQ(Bad(1, path + "a"), Whole("GET " + path + "a HTTP/1.0\r\n\r\n"));
    // The limit is for the text before it is decoded, and the query does not count.
    std::string escaped = "/";
    for (int i = 0; i < 2730; ++i)
        escaped += "%61";
    EXPECT_EQ(Get(escaped, "/" + std::string(2730, 'a'), "", std::string(9000, 'q')),
              Whole("GET " + escaped + "?" + std::string(9000, 'q') + " HTTP/1.0\r\n\r\n"));
    EXPECT_EQ(With(Bad(1, escaped + "a"), &Outcome::query, "q"), Whole("GET " + escaped + "a?q HTTP/1.0\r\n\r\n"));
}

TEST(OxRequest, CredentialsOf255CharactersAreTheLongest) {
    // Groups of "AAAA" are three NULs each; "YTph" is "a:a".
    std::string pair;
    for (int i = 0; i < 85; ++i)
        pair += "YTph";
    std::string password = "a";
    for (int i = 1; i < 85; ++i)
        password += "a:a";
    EXPECT_EQ(Login("a", password), Whole(HEAD + "Authorization: Basic " + pair + "\r\n\r\n"));
    EXPECT_EQ(GetUrl("/x"), Whole(HEAD + "Authorization: Basic " + pair + "YQ==\r\n\r\n"));
}

}  // namespace
