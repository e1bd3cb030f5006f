#include "resources/staticfile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "protocol/testsockets.h"
#include "testing/manualclock.h"
#include "testing/scratch.h"

namespace {

const std::string SERVED = "Sun, 06 Nov 1994 08:49:37 GMT";    // the clock's time
const std::string MODIFIED = "Thu, 01 Jan 1987 00:00:00 GMT";  // every file's time
const std::string EARLIER = "Wed, 31 Dec 1986 23:59:59 GMT";
constexpr std::time_t MODIFIED_SECONDS = 536457600;

class OxResourceStaticFile : public testing::Test {
protected:
    void Write(const std::string& name, const std::string& content, std::time_t modified = MODIFIED_SECONDS) const {
        const UniqueFd file = OpenFile(m_root + name, O_WRONLY | O_CREAT | O_TRUNC, 0644);
        ASSERT_TRUE(file);
        ASSERT_TRUE(WriteAll(file.Get(), content.data(), content.size()));
        const timespec times[2] = {{modified, 999999999}, {modified, 999999999}};
        ASSERT_EQ(0, ::futimens(file.Get(), times));
    }

    struct Answer {
        std::string text;
        std::vector<std::string> lines;
        std::uint32_t contentSize;
    };
    // What a request for the URL path gets.
    Answer Ask(const std::string& path, const std::string& since = {}, bool ignore = false) const {
        return AskRoot(m_root, path, since, ignore);
    }
    static Answer AskRoot(const std::string& root, const std::string& path, const std::string& since = {},
                          bool ignore = false) {
        Connection connection;
        LineLog log;
        ManualClock clock;
        oxTimeStamp stamp(clock);
        const auto request = std::make_unique<oxRequest>();
        connection.PeerSend("GET " + path + " HTTP/1.0\r\n" +
                            (since.empty() ? "" : "If-Modified-Since: " + since + "\r\n") + "\r\n");
        EXPECT_TRUE(request->Read(connection.Server(), log) && request->Parse());
        const auto reply = oxResource_StaticFile(root, ignore).GetReply(*request);
        reply->SetClock(clock);
        std::string text;
        std::jthread peer([&] { text = connection.PeerReadAll(); });
        reply->Send(connection.Server(), stamp, log);
        connection.Server().Shutdown(SHUT_WR);
        peer.join();
        return {text, log.Lines(), reply->GetContentSize()};
    }

    static std::string Ok(const std::string& type, const std::string& body, const std::string& expires = {}) {
        return "HTTP/1.0 200 OK\r\nServer: Orvex HTTP Server V3.5c\r\nAllow: GET, POST\r\nContent-Type: " + type +
               "\r\nDate: " + SERVED + "\r\n" + expires + "Last-Modified: " + MODIFIED + "\r\n\r\n" + body;
    }
    static std::string NotModified(const std::string& expires = {}) {
        return "HTTP/1.0 304 Not Modified\r\nDate: " + SERVED + "\r\n" + expires +
               "Server: Orvex HTTP Server V3.5c\r\n\r\n";
    }
    static std::string NotFound() { return oxReply(Http::NOT_FOUND_404).ComposeHeader(); }

    const Scratch m_scratch;
    const std::string m_root = m_scratch.Path();
};

const std::string EXPIRES = "Expires: Tue, 06 Dec 1994 08:49:37 GMT\r\n";

TEST_F(OxResourceStaticFile, Table) {
    ASSERT_EQ(0, ::mkdir((m_root + "/reports").c_str(), 0755));
    ASSERT_EQ(0, ::mkdir((m_root + "/dir.gif").c_str(), 0755));
    Write("/default.htm", "home");
    Write("/reports/default.htm", "reports");
    Write("/a.HTM", "upper");
    Write("/a.html", "html");
    Write("/a.gif", "gif");
    Write("/a.jpg", "jpg");
    Write("/plain", "plain");
    Write("/dir.gif/plain", "no type");
    Write("/empty.htm", "");
    Write("/own.htm", "<head><meta http-equiv=\"Content-Type\" content=\"a/B\"></head>");
    const struct {
        std::string path;
        std::string since;
        bool ignore;
        std::string expected;
    } cases[] = {
        {"/", "", false, Ok("text/html", "home")},
        {"/default.htm", "", false, Ok("text/html", "home")},
        {"/reports/", "", false, Ok("text/html", "reports")},
        {"/a.HTM", "", false, Ok("", "upper")},
        {"/a.html", "", false, Ok("", "html")},
        {"/a.gif", "", false, Ok("image/gif", "gif", EXPIRES)},
        {"/a.jpg", "", false, Ok("", "jpg")},
        {"/plain", "", false, Ok("", "plain")},
        {"/dir.gif/plain", "", false, Ok("", "no type")},
        {"/reports/../plain", "", false, Ok("", "plain")},
        {"/pl%61in", "", false, Ok("", "plain")},
        {"/default.htm%00.pl", "", false, Ok("text/html", "home")},
        {"/empty.htm", "", false, Ok("text/html", "")},
        {"/own.htm", "", false, Ok("a/b", "<head><meta http-equiv=\"Content-Type\" content=\"a/B\"></head>")},
        {"/absent.htm", "", false, NotFound()},
        {"/absent/", "", false, NotFound()},
        {"/plain/", "", false, NotFound()},
        // Conditions: whole seconds.
        {"/default.htm", MODIFIED, false, NotModified()},
        {"/", MODIFIED, false, NotModified()},
        {"/default.htm", SERVED, false, NotModified()},
        {"/a.gif", MODIFIED, false, NotModified(EXPIRES)},
        {"/default.htm", EARLIER, false, Ok("text/html", "home")},
        {"/default.htm", "no date", false, Ok("text/html", "home")},
        {"/default.htm", MODIFIED, true, Ok("text/html", "home")},
        {"/absent.htm", MODIFIED, false, NotFound()},
        {"/absent.htm", MODIFIED, true, NotFound()},
        {"/absent.gif", MODIFIED, false, NotFound()},
        {"/reports", SERVED, true, ""},
    };
    for (const auto& c : cases)
        EXPECT_EQ(c.expected, Ask(c.path, c.since, c.ignore).text) << c.path << " " << c.since << " " << c.ignore;
}

// A condition that is no date counts as the first second of 1970; none, or an empty one, asks for nothing.
TEST_F(OxResourceStaticFile, ConditionsOnFilesOf1970AndBefore) {
    static constexpr const char* EMPTY = "\r\nX: y";  // the header has no value; another stands behind it
    const struct {
        std::time_t modified;
        const char* since;
        const char* status;
    } cases[] = {
        {0, "", "200 OK"},
        {0, EMPTY, "200 OK"},
        {0, " ", "304 Not Modified"},
        {0, "no date", "304 Not Modified"},
        {0, "Thu, 01 Jan 1970 00:00:00 GMT", "304 Not Modified"},
        {0, "Wed, 31 Dec 1969 23:59:59 GMT", "200 OK"},
        {1, "no date", "200 OK"},
        {-1, "", "200 OK"},
        {-1, EMPTY, "200 OK"},
        {-1, "no date", "304 Not Modified"},
        {-1, "Wed, 31 Dec 1969 23:59:59 GMT", "304 Not Modified"},
        {-1, "Wed, 31 Dec 1969 23:59:58 GMT", "200 OK"},
    };
    for (const auto& c : cases) {
        Write("/old.htm", "old", c.modified);
        const std::string text = Ask("/old.htm", c.since).text;
        EXPECT_TRUE(text.starts_with(std::string("HTTP/1.0 ") + c.status + "\r\n"))
            << c.modified << " " << c.since << ": " << text;
    }
}

TEST_F(OxResourceStaticFile, RootAndPathAreJoinedAsTheyStand) {
    Write("/plain", "plain");
    EXPECT_EQ(Ok("", "plain"), AskRoot(m_root + "/", "/plain").text);
    EXPECT_EQ(Ok("", "plain"), AskRoot("", m_root + "/plain").text);
}

TEST_F(OxResourceStaticFile, DirectoryOpensAndSendsNothing) {
    ASSERT_EQ(0, ::mkdir((m_root + "/images").c_str(), 0755));
    const Answer answer = Ask("/images");
    EXPECT_EQ("", answer.text);
    ASSERT_EQ(1u, answer.lines.size());
    EXPECT_TRUE(answer.lines[0].starts_with("Reply error reading file - handle = ")) << answer.lines[0];
}

TEST_F(OxResourceStaticFile, FifoDoesNotHang) {
    ASSERT_EQ(0, ::mkfifo((m_root + "/fifo").c_str(), 0644));
    const Answer answer = Ask("/fifo");
    EXPECT_TRUE(answer.text.starts_with("HTTP/1.0 200 OK\r\n")) << answer.text;
    EXPECT_TRUE(answer.text.ends_with("\r\n\r\n")) << answer.text;
    EXPECT_TRUE(answer.lines.empty());
}

TEST_F(OxResourceStaticFile, FileThatMayNotBeOpenedIsNotFound) {
    Write("/a", "x");
    ASSERT_EQ(0, ::symlink("loop", (m_root + "/loop").c_str()));
    EXPECT_EQ(NotFound(), Ask("/loop").text);
    EXPECT_EQ(NotFound(), Ask("/" + std::string(300, 'n')).text);
    if (::geteuid() != 0) {  // root may read everything
        ASSERT_EQ(0, ::chmod((m_root + "/a").c_str(), 0));
        EXPECT_EQ(NotFound(), Ask("/a").text);
    }
}

TEST_F(OxResourceStaticFile, WithoutADescriptorLeftNoFileIsFound) {
    Write("/plain", "plain");
    Connection connection;
    LineLog log;
    oxRequest request;
    connection.PeerSend("GET /plain HTTP/1.0\r\n\r\n");
    ASSERT_TRUE(request.Read(connection.Server(), log) && request.Parse());
    oxResource_StaticFile resource(m_root, false);
    rlimit before{};
    ASSERT_EQ(0, ::getrlimit(RLIMIT_NOFILE, &before));
    UniqueFd next = OpenFile("/dev/null", O_RDONLY);
    ASSERT_TRUE(next);
    const rlimit full{.rlim_cur = static_cast<rlim_t>(next.Get()), .rlim_max = before.rlim_max};
    next.Reset();
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &full));
    const auto reply = resource.GetReply(request);
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &before));
    EXPECT_EQ(NotFound(), reply->ComposeHeader());
    EXPECT_EQ(0u, reply->GetContentSize());
    EXPECT_EQ(&Http::OK_200, &resource.GetReply(request)->GetStatus());
}

TEST_F(OxResourceStaticFile, ContentSizeIsTheFilesSizeIn32Bits) {
    Write("/small", "12345");
    EXPECT_EQ(5u, Ask("/small").contentSize);
    EXPECT_EQ(0u, Ask("/absent").contentSize);
    EXPECT_EQ(0u, Ask("/small", MODIFIED).contentSize);

    // Only asked for, not sent: it is 5 GB long.
    Write("/huge", "");
    ASSERT_EQ(0, ::truncate((m_root + "/huge").c_str(), 5LL << 30));
    Connection connection;
    LineLog log;
    oxRequest request;
    connection.PeerSend("GET /huge HTTP/1.0\r\n\r\n");
    ASSERT_TRUE(request.Read(connection.Server(), log) && request.Parse());
    EXPECT_EQ(1u << 30, oxResource_StaticFile(m_root, false).GetReply(request)->GetContentSize());
}

TEST_F(OxResourceStaticFile, FileOfManyBlocks) {
    std::string body(50000, '\0');
    for (std::size_t i = 0; i < body.size(); ++i)
        body[i] = static_cast<char>(i * 13 + i / 249);
    Write("/blocks.xls", body);
    const Answer answer = Ask("/blocks.xls");
    EXPECT_EQ(Ok("application/msexcel", body), answer.text);
    EXPECT_EQ(50000u, answer.contentSize);
}

TEST_F(OxResourceStaticFile, NoDescriptorIsLeftOpen) {
    Write("/plain", "plain");
    const auto count = [] {
        std::size_t descriptors = 0;
        for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
            descriptors += entry.path().empty() ? 0 : 1;
        return descriptors;
    };
    const std::size_t before = count();
    for (int i = 0; i < 20; ++i) {
        Ask("/plain");
        Ask("/plain", MODIFIED);
        Ask("/absent");
    }
    EXPECT_EQ(before, count());
}

}  // namespace
